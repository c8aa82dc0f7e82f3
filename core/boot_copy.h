// When the logs held in /data go to the log path: after a client's command,
// after the boot-copy wait, and once the card appears in the kelm boot.
#pragma once

class LogController;

#define TEMP_FOLDER "/data/log_temp/"
// What the boot before held in TEMP_FOLDER and never copied, kept for the next copy.
#define PREV_BOOT_FOLDER "/data/log_temp_prev/"
#define HBR_FOLDER "/data/log_hbr/"
#define OTHER_MODE_FOLDER "/data/log_other_mode/"

// Copies every holding folder into the controller's run folder.
void copy_saved_logs(LogController* controller);
// Stops the run and copies what the boot before held, then /data/log_temp/,
// into a new BOOTFAIL_ folder: 0, or -1 when the folder could not be made or
// the card failed during the copy.
int boot_fail_copy(LogController* controller);
// Waits up to 30 s for the log path to become a link to the card, then moves
// the run there and copies what it held; stops the run when no card came.
void kelm_mode_copy(LogController* controller);

// Other boots are numbered 1, 2, ... below this.
constexpr int OTHER_MODE_NUMBER_LIMIT = 1000000;
// The boot number a folder of OTHER_MODE_FOLDER holds (read as atoi would),
// or 0 when it holds none.
int other_mode_number(const char* name);
