// Starting, stopping and moving a logging run.
#pragma once

class LogController;

void compose_run_folder(LogController* controller);
int create_run_folder(LogController* controller, const char* base, const char* path);
int calc_rotate_size(LogController* controller, int megabytes);
void start_logging(LogController* controller);
void stop_logging(LogController* controller);
// Sets debug.TQ.realpath, where the history log finds the run's own file.
void publish_run_folder(const char* path);
void switch_run_folder(LogController* controller, const char* path);
void signal_child(int pid, int sig);
void signal_children(LogController* controller, int sig);
void oru_mode_on();
void oru_mode_off();
