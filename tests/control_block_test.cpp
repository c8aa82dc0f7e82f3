// The control block as both sides see it: the controller reads fixed byte
// offsets, the collectors write through ControlBlock in their own mapping.
#include <fcntl.h>
#include <semaphore.h>
#include <stdint.h>
#include <string.h>
#include <sys/mman.h>
#include <sys/wait.h>
#include <unistd.h>

#include <cutils/ashmem.h>
#include <gtest/gtest.h>

#include "collectors/collector_link.h"
#include "collectors/control_block.h"

namespace {

int32_t word_at(const void* base, size_t offset) {
    int32_t value;
    memcpy(&value, static_cast<const char*>(base) + offset, sizeof(value));
    return value;
}

TEST(ControlBlock, CollectorAndControllerAgreeOnARealMapping) {
    int fd = ashmem_create_region(CONTROL_BLOCK_NAME, CONTROL_BLOCK_SIZE);
    ASSERT_GE(fd, 0);
    sem_unlink(CONTROL_SEM_NAME);
    sem_t* sem = sem_open(CONTROL_SEM_NAME, O_CREAT, 0644, 1);
    ASSERT_NE(sem, SEM_FAILED);
    void* controller_view =
        mmap(nullptr, CONTROL_BLOCK_SIZE, PROT_READ | PROT_WRITE, MAP_SHARED, fd, 0);
    ASSERT_NE(controller_view, MAP_FAILED);
    memset(controller_view, 0, CONTROL_BLOCK_SIZE);
    for (int slot = 1; slot <= 5; slot++) {
        int32_t none = REASON_NONE;
        memcpy(static_cast<char*>(controller_view) + 264 * slot + 4, &none, sizeof(none));
    }

    // Each collector letter marks its own slot with a distinct reason, through
    // the collector's own mapping of the same descriptor.
    struct Case {
        CollectorKind kind;
        char letter;
        int reason;
    };
    const Case cases[] = {{KIND_ANDROID, 'M', 5}, {KIND_ANDROID, 'R', 6}, {KIND_ANDROID, 'E', 8},
                          {KIND_KERNEL, 'K', 10}, {KIND_BT, 'B', 12}};
    for (const Case& c : cases) {
        pid_t pid = fork();
        ASSERT_GE(pid, 0);
        if (pid == 0) {
            CollectorLink collector(c.kind, c.letter);
            collector.shm_fd = fd;
            if (!attach_control_block(&collector)) _exit(99);
            exit_collector(&collector, 0, c.reason);
        }
        int status = 0;
        ASSERT_EQ(waitpid(pid, &status, 0), pid);
        ASSERT_TRUE(WIFEXITED(status));
        EXPECT_EQ(WEXITSTATUS(status), 0) << c.letter;
    }

    // The controller's byte offsets: exited at 264*k, reason at 264*k + 4.
    for (int slot = 1; slot <= 5; slot++) {
        EXPECT_EQ(word_at(controller_view, 264 * slot), 1) << "slot " << slot;
        EXPECT_EQ(word_at(controller_view, 264 * slot + 4), cases[slot - 1].reason) << "slot " << slot;
    }
    // Nothing outside the ten words was touched.
    for (size_t offset = 0; offset < CONTROL_BLOCK_SIZE; offset += 4) {
        if (offset % 264 <= 4 && offset >= 264) continue;
        EXPECT_EQ(word_at(controller_view, offset), 0) << "offset " << offset;
    }

    // And the stop word the controller writes at offset 0 is what a collector reads.
    int32_t one = 1;
    memcpy(controller_view, &one, sizeof(one));
    pid_t pid = fork();
    ASSERT_GE(pid, 0);
    if (pid == 0) {
        CollectorLink collector(KIND_KERNEL, 'K');
        collector.shm_fd = fd;
        if (!attach_control_block(&collector)) _exit(99);
        _exit(control_stop(collector.shm) == 1 ? 0 : 1);
    }
    int status = 0;
    ASSERT_EQ(waitpid(pid, &status, 0), pid);
    EXPECT_TRUE(WIFEXITED(status) && WEXITSTATUS(status) == 0);

    munmap(controller_view, CONTROL_BLOCK_SIZE);
    sem_close(sem);
    sem_unlink(CONTROL_SEM_NAME);
    close(fd);
}

}  // namespace
