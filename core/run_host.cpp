#include "core/run_host.h"

#include <stdint.h>
#include <unistd.h>

#include "common/io_util.h"
#include "core/log_controller.h"
#include "core/peer_auth.h"
#include "core/reply_client.h"

namespace {

class RunHost : public TransistHost {
  public:
    LogController* controller = nullptr;

    const char* space_root() const override { return controller->current_log_root(); }

    // The clients hear it first; the control loop then ends the run.
    void writer_gave_up(const char* broadcast, uint64_t event) override {
        reply_client(controller, -1, broadcast);
        if (controller->efd_thread < 0) return;
        TEMP_FAILURE_RETRY(write(controller->efd_thread, &event, sizeof(event)));
    }

    int flush_records() override { return peer_records_flush(); }
};

RunHost host;

}  // namespace

TransistHost* run_host(LogController* controller) {
    host.controller = controller;
    return &host;
}
