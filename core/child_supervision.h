// Noticing collectors that die during a run.
#pragma once

class LogController;

// SIGCHLD handler: only notifies the control thread through efd_chld.
void sigchld_handler(int sig);
// Reaps every ended child, recording each.
void reap_children();
// On the control thread: reaps ended children (recording each), then checks
// which collectors died, reports one warning and stops the run when none is left.
void check_children(LogController* controller);
