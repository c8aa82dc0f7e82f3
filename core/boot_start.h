// What the daemon does once per boot, before it serves clients.
#pragma once

class LogController;

// Records the boot mode, takes the path of the mode (normal 0, kelm 1, any
// other value an other boot), which may start a run, and starts the control
// socket. Returns once the control thread runs.
void boot_start(LogController* controller, int boot_mode);

// Points the run at /data/log_temp/ and prepares that folder, keeping what
// the boot before held there and never copied in /data/log_temp_prev/; sets
// data_storage_low. 0 when the folder cannot be made.
int start_in_temp_folder(LogController* controller);
