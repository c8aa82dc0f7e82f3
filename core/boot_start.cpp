#include "core/boot_start.h"

#include <unistd.h>

#include "common/wlog.h"
#include "config/config_store.h"
#include "core/control_socket.h"
#include "core/log_controller.h"
#include "storage/history_log.h"

void boot_start(LogController* controller, int boot_mode) {
    controller->boot_mode = boot_mode;
    history_log(0, "boot mode: %d", boot_mode);
    WLOG(TAG_MAIN, WLOG_INFO, "boot mode: %d", boot_mode);

    ConfigCache config;
    config_init(&config);
    // The first boot seeds the configuration from the system image's defaults.
    if (access(CONFIG_FILE, F_OK) == 0) {
        config_load(&config);
    } else {
        config_read_system_defaults(&config);
        config_write(&config);
    }
    controller->load_boot_options(config);

    start_control_socket(controller);
}
