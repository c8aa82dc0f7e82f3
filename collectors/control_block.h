// The run's shared control block: how the controller tells the collectors to
// stop and how each collector records that it ended and why.
#pragma once

#include <stddef.h>
#include <stdint.h>

constexpr int CONTROL_SLOT_COUNT = 6;
constexpr int CONTROL_SLOT_SIZE = 264;
constexpr int CONTROL_BLOCK_SIZE = CONTROL_SLOT_COUNT * CONTROL_SLOT_SIZE;  // 1584
#define CONTROL_BLOCK_NAME "tavlolog"
#define CONTROL_SEM_NAME "tavlolog"

// Slot 0 uses the first word as `stop`; slots 1..5 use `exited` and `reason`.
struct ControlSlot {
    int32_t exited;  // slot 0: stop
    int32_t reason;
    uint8_t unused[CONTROL_SLOT_SIZE - 8];
};

struct ControlBlock {
    ControlSlot slots[CONTROL_SLOT_COUNT];
};

static_assert(sizeof(ControlSlot) == 264, "slot layout is shared with the collectors");
static_assert(sizeof(ControlBlock) == 1584, "block layout is shared with the collectors");
static_assert(offsetof(ControlBlock, slots[1].exited) == 264, "main slot");
static_assert(offsetof(ControlBlock, slots[1].reason) == 268, "main slot reason");
static_assert(offsetof(ControlBlock, slots[2].exited) == 528, "radio slot");
static_assert(offsetof(ControlBlock, slots[3].exited) == 792, "events slot");
static_assert(offsetof(ControlBlock, slots[4].exited) == 1056, "kernel slot");
static_assert(offsetof(ControlBlock, slots[5].reason) == 1324, "bluetooth slot reason");

// Slot of each collector: the log type index plus 1.
enum { SLOT_RUN = 0, SLOT_MAIN = 1, SLOT_RADIO = 2, SLOT_EVENTS = 3, SLOT_KERNEL = 4, SLOT_BT = 5 };

// Reason codes a collector leaves in its slot.
enum {
    REASON_NONE = -1,
    REASON_SIGNAL = 0,
    REASON_OUTPUT = 5,
    REASON_READ = 6,
    REASON_FORMAT = 8,
    REASON_OPEN = 10,
    REASON_BT_TIMEOUT = 12,
};

inline int32_t& control_stop(ControlBlock* block) { return block->slots[SLOT_RUN].exited; }
