// Moving logs held in a folder of /data onto the log path: each held piece
// appended, oldest first, to one file per log type in the run folder, with a
// note line before each piece, and deleted once it is safely there.
#pragma once

class LogController;

enum CopyResult {
    COPY_ABORT = -1,  // the destination failed (a full card): end this copy
    COPY_KEPT = 0,    // this source is kept for a later copy
    COPY_DONE = 1,    // copied and deleted, or there was nothing to copy
};

// Folder paths end in '/'. Sources lie below /data, destinations below the
// controller's log path.
CopyResult copy_log_folder(LogController* controller, const char* src_dir, const char* dst_dir,
                           const char* suffix);
CopyResult copy_rotated_log(LogController* controller, const char* src_dir, const char* dst_dir,
                            const char* name, const char* suffix);
CopyResult copy_remaining_files(LogController* controller, const char* src_dir,
                                const char* dst_dir);
CopyResult copy_named_file(LogController* controller, const char* src_dir, const char* dst_dir,
                           const char* name);
CopyResult copy_log_file(LogController* controller, const char* src, const char* dst);
