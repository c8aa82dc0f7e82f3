// Fork wrappers: start one collector process each. In the parent they return 0
// (pid stored in the controller) or -1 when fork failed; in the child they never return.
#pragma once

class LogController;

int fork_kernel_log(LogController* controller, int shm_fd);
int fork_main_log(LogController* controller, int shm_fd);
int fork_radio_log(LogController* controller, int shm_fd);
int fork_events_log(LogController* controller, int shm_fd);
int fork_bt_log(LogController* controller, int shm_fd);
