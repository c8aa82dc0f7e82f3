// KmsgCat: the kernel log collector. Forwards /proc/kmsg to the transist as
// stream "K", chunk by chunk, unchanged.
#pragma once

#include "collectors/collector_link.h"

class KmsgCat : public CollectorLink {
  public:
    KmsgCat() : CollectorLink(KIND_KERNEL, 'K') {}
    ~KmsgCat() override {}

    // Runs in the collector child. Returns only after a failed send; every
    // other ending goes through exit_collector.
    void run(const char* name, int shm_fd);

    // The kernel log source; tests point it at a FIFO.
    static const char* kmsg_path;

    // The forwarding loop over the open source descriptor; tests run it on a
    // descriptor of their own.
    void forward(int kmsg_fd);
};
