// Starting, stopping and moving a logging run.
#pragma once

class LogController;

void compose_run_folder(LogController* controller);
// Creates path and its missing folders (mode 0770) below base, a leading part
// of it trusted as it stands; nothing below base is created or opened through
// a link. Returns 1 when the folder is there, else -1 with errno set.
int create_run_folder(LogController* controller, const char* base, const char* path);
int calc_rotate_size(LogController* controller, int megabytes);
void start_logging(LogController* controller);
// Sets debug.TQ.collectors from the run's options and collector pids.
void publish_collectors(const LogController* controller);
void stop_logging(LogController* controller);
// Sets debug.TQ.realpath, where the history log finds the run's own file, and
// tells the history which part of it is trusted (the controller's log path).
void publish_run_folder(LogController* controller, const char* path);
void switch_run_folder(LogController* controller, const char* path);
void signal_child(int pid, int sig);
void signal_children(LogController* controller, int sig);
void oru_mode_on();
void oru_mode_off();
