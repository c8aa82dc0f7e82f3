// BtCat: the Bluetooth log collector. Connects to the Bluetooth stack's log
// service "btlog" and forwards what it reads to the transist as stream "B",
// chunk by chunk, unchanged.
#pragma once

#include "collectors/collector_link.h"

#define BT_LOG_SOCKET_NAME "btlog"

class BtCat : public CollectorLink {
  public:
    BtCat() : CollectorLink(KIND_BT, 'B') {}
    ~BtCat() override {}

    // Runs in the collector child. Returns after a failed send; every other
    // ending goes through exit_collector.
    void run(const char* name, int shm_fd);
    // The forwarding loop over mSockListenId; tests run it on a descriptor
    // of their own.
    void forward();

    int mSockListenId = 0;  // connection to "btlog", 0 until connected

    // Pause between attempts to reach "btlog" and before ending after a read
    // failure: 1 s on the phone, shortened by tests.
    static unsigned int pause_us;

  private:
    void connect_service();
    // Sends what the service has sent so far, then ends (asked to stop).
    [[noreturn]] void finish_at_stop(int reason);
};
