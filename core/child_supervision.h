// Noticing collectors that die during a run.
#pragma once

class LogController;

// SIGCHLD handler: only notifies the control thread through the controller's
// efd_chld, which the controller hands over when it is made.
void sigchld_handler(int sig);
void set_sigchld_notice(int efd_chld);
// Reaps every ended child, recording each.
void reap_children();
// On the control thread: reaps ended children (recording each), then checks
// which collectors died, reports one warning and stops the run when none is left.
void check_children(LogController* controller);
