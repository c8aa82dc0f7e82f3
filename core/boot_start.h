// What the daemon does once per boot, before it serves clients.
#pragma once

class LogController;

// Records the boot mode, creates or loads the configuration, loads the run
// options and starts the control socket. Returns once the control thread runs.
void boot_start(LogController* controller, int boot_mode);
