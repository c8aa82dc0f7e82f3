// Moving logs held in a folder of /data onto the log path: each held piece
// appended, oldest first, to one file per log type in the run folder, with a
// note line before each piece, and deleted once it is safely there.
#pragma once

#include "common/log_types.h"

// What a copy of held logs is told; core builds it from the controller.
struct HeldCopy {
    const char* log_root;          // destinations lie below it
    bool enabled[LOG_TYPE_COUNT];  // which rotated logs are copied by name
    bool data_low;                 // the note line says some held logs were not saved
    int* warned;                   // the once-per-run warning flag, shared with supervision
};

enum CopyResult {
    COPY_ABORT = -1,  // the destination failed (a full card): end this copy
    COPY_KEPT = 0,    // this source is kept for a later copy
    COPY_DONE = 1,    // copied and deleted, or there was nothing to copy
};

// Folder paths end in '/'. Sources lie below /data, destinations below the
// copy's log root.
CopyResult copy_log_folder(const HeldCopy& copy, const char* src_dir, const char* dst_dir, const char* suffix);
CopyResult copy_rotated_log(const HeldCopy& copy, const char* src_dir, const char* dst_dir, const char* name,
                            const char* suffix);
CopyResult copy_remaining_files(const HeldCopy& copy, const char* src_dir, const char* dst_dir);
CopyResult copy_named_file(const HeldCopy& copy, const char* src_dir, const char* dst_dir, const char* name);
CopyResult copy_log_file(const HeldCopy& copy, const char* src, const char* dst);
