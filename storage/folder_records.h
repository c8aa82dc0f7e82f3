// The record of the run folders below the log path, oldest first, each with
// its size in KiB, kept within the configured budget. Forgetting a folder
// removes its line only: the daemon never deletes a user's log folders.
#pragma once

#include <stddef.h>
#include <stdint.h>

#define INTER_SD_RECORDS "inter_sd_folder"  // location 1, in /data/misc/tqlog
#define OUTER_SD_RECORDS "outer_sd_folder"  // location 2

constexpr int RECORD_NAME_LEN = 255;

struct FolderRecord {
    char name[RECORD_NAME_LEN];
    int size_kb;  // 0 not measured yet, -1 the folder is gone
    FolderRecord* next;
};

// Records the folder run_folder (ending in '/', below the log path root) just
// created, with the sizes of the earlier ones; total_size and log_size in MB.
// 1 when the record was updated, 0 when the parent folder could not be listed.
int update_folder_records(const char* root, const char* run_folder, int location, int total_size,
                          int log_size);

FolderRecord* read_folder_records(int location);
// The lines "<name> <size_kb>" of a records file's bytes, in order.
FolderRecord* parse_folder_records(const char* text, size_t len);
int write_folder_records(const FolderRecord* list, const char* new_name, int location);
// The entries of the folder dirfd, nullptr when there are none or it cannot
// be listed (*failed set then).
FolderRecord* list_folder_entries(int dirfd, const char* path, bool* failed);
int folder_size_kb(int parent_fd, const char* parent, const char* name);
void drop_missing_records(FolderRecord** list);
void drop_oldest_records(FolderRecord** list, uint64_t used_kb, uint64_t budget_kb);
void free_folder_records(FolderRecord* list);
