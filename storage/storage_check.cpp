#include "storage/storage_check.h"

#include <errno.h>
#include <sys/statfs.h>

#include "common/io_util.h"
#include "platform/properties.h"
#include "record/record.h"

uint64_t get_free_space(const char* path, int retries) {
    while (retries >= 0) {
        struct statfs st;
        if (TEMP_FAILURE_RETRY(statfs(path, &st)) != 0) {
            // Saved first: the history record itself may change errno.
            int err = errno;
            HLOG(TAG_UTIL, WLOG_ERROR, "Failed to get the file status of %s, errno=%d", path, err);
            return 0;
        }
        // An unmounted card shows as a file system without blocks.
        if (st.f_blocks != 0) {
            // In 64 bits: a card above 4 GiB must not wrap into a "low" one.
            return static_cast<uint64_t>(st.f_bavail) * static_cast<uint64_t>(st.f_bsize);
        }
        HLOG(TAG_UTIL, WLOG_ERROR, "SD card is unavailable!! Retrying!");
        retries--;
    }
    HLOG(TAG_UTIL, WLOG_ERROR, "SD card is unavailable! We have retried!");
    return 0;
}

int is_free_space_low(uint64_t free_bytes) {
    return free_bytes < LOW_STORAGE_BYTES ? 1 : 0;
}

int is_storage_low(const char* path) {
    if (is_free_space_low(get_free_space(path, 0))) {
        HLOG(TAG_UTIL, WLOG_ERROR, "%s is almost full or unavailable!!", path);
        return 1;
    }
    return 0;
}

void report_system_warning(int type) {
    if (type < 0) return;
    char progress[PROPERTY_VALUE_MAX];
    property_get("vold.encrypt_progress", progress, "");
    HLOG(TAG_MAIN, WLOG_ERROR, "prop:%s,temp:%s", "vold.encrypt_progress", progress);
    // While the phone encrypts its storage, logging breaking down is expected.
    if (progress[0] != '\0') {
        // "encryping" as stored histories and tools have it.
        HLOG(TAG_MAIN, WLOG_ERROR, "phone is encryping, will not show red screen:%s", progress);
        return;
    }
    HLOG(TAG_MAIN, WLOG_ERROR, "oru warning comes,type is %d", type);
    switch (type) {
        case 5:
            HLOG(TAG_MAIN, WLOG_ERROR, "out put to log file failed");
            break;
        case 11:
            HLOG(TAG_MAIN, WLOG_ERROR, "sdcard is full");
            break;
        default:
            HLOG(TAG_MAIN, WLOG_ERROR, "oru type %d comes", type);
            break;
    }
}
