// The run's shared control block: how the controller tells the collectors to
// stop and how each collector records that it ended and why.
#pragma once

#include <semaphore.h>
#include <stddef.h>
#include <stdint.h>
#include <string.h>

#include "common/log_types.h"

constexpr int CONTROL_SLOT_COUNT = 6;
constexpr int CONTROL_SLOT_SIZE = 264;
constexpr int CONTROL_BLOCK_SIZE = CONTROL_SLOT_COUNT * CONTROL_SLOT_SIZE;  // 1584
#define CONTROL_BLOCK_NAME "tavlolog"
// The semaphore's name in records.
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

// The slot of a log type's collector: the types in their order, after the run's slot.
inline int control_slot_of(int type) { return SLOT_MAIN + type; }
static_assert(SLOT_MAIN == 1 + LOG_MAIN && SLOT_RADIO == 1 + LOG_RADIO && SLOT_EVENTS == 1 + LOG_EVENTS &&
                  SLOT_KERNEL == 1 + LOG_KERNEL && SLOT_BT == 1 + LOG_BT,
              "slots follow the log types");

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

// The semaphore that guards the words above lives in the block itself, in the
// unused bytes of slot 0: unnamed and process-shared, it needs no named
// semaphores (which Android's C library lacks), every process that maps the
// block has it, and it goes with the run's region.
constexpr size_t CONTROL_SEM_OFFSET = 8;
static_assert(CONTROL_SEM_OFFSET >= offsetof(ControlSlot, unused), "clear of the stop word");
static_assert(CONTROL_SEM_OFFSET + sizeof(sem_t) <= CONTROL_SLOT_SIZE, "inside slot 0");
static_assert(CONTROL_SEM_OFFSET % alignof(sem_t) == 0, "aligned (the mapping is page-aligned)");

inline sem_t* control_sem(ControlBlock* block) {
    return reinterpret_cast<sem_t*>(reinterpret_cast<unsigned char*>(block) + CONTROL_SEM_OFFSET);
}

// Makes block a fresh run's block: every word clear, no reasons, the semaphore
// free. Returns 0, or -1 (errno set) when the semaphore cannot be made.
inline int control_block_init(ControlBlock* block) {
    memset(block, 0, sizeof(*block));
    for (int slot = SLOT_MAIN; slot <= SLOT_BT; slot++) block->slots[slot].reason = REASON_NONE;
    return sem_init(control_sem(block), 1, 1);
}
