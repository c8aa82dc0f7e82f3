// Entry of tavlo_log_d: drop privileges, record the start, read the boot mode,
// build the controller and hand over to the boot path.
#include <signal.h>
#include <sys/stat.h>
#include <unistd.h>

#include "common/wlog.h"
#include "core/boot_mode.h"
#include "core/boot_start.h"
#include "core/log_controller.h"
#include "core/privileges.h"
#include "platform/properties.h"
#include "storage/history_log.h"
#include "transist/transist.h"

int main() {
    // A client or collector that has gone must give EPIPE, not end the daemon.
    signal(SIGPIPE, SIG_IGN);
    // A daemon restarted after a death finds its predecessor's run in these:
    // before anything reads them, no run is live and no run folder may receive
    // this daemon's records.
    property_set(PROP_REALPATH, "");
    property_set(PROP_RUNNING, "0");

    if (getuid() != 0) {
        HLOG(TAG_DEBUG, WLOG_INFO, "[== First Log ==] tavlo_log_d is not in root user");
    } else {
        drop_privileges();
    }

    history_log(0, "****** TQLOG START *******");
    WLOG(TAG_DEBUG, WLOG_INFO, "****** TQLOG START *******");

    // Before any app runs: an app that bound "log_socket" first would keep
    // every run from recording. Held for the daemon's life.
    transist_listen();

    // Every file and folder gets exactly the mode it is created with.
    umask(0);
    int mode = read_boot_mode();

    LogController* controller = new LogController();
    boot_start(controller, mode);

    for (;;) sleep(2000);
}
