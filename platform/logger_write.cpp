#include "platform/logger_write.h"

#include <errno.h>
#include <fcntl.h>
#include <stdlib.h>
#include <string.h>
#include <unistd.h>

#include "common/io_util.h"
#include "common/unique_fd.h"

size_t logger_text_payload(int priority, const char* tag, const char* message, uint8_t* out, size_t cap) {
    if (cap > LOGGER_MAX_PAYLOAD) cap = LOGGER_MAX_PAYLOAD;
    if (cap < 3) return 0;
    size_t at = 0;
    out[at++] = static_cast<uint8_t>(priority);
    size_t tag_len = strnlen(tag, cap - 3);
    memcpy(out + at, tag, tag_len);
    at += tag_len;
    out[at++] = '\0';
    size_t msg_len = strnlen(message, cap - at - 1);
    memcpy(out + at, message, msg_len);
    at += msg_len;
    out[at++] = '\0';
    return at;
}

namespace {

struct EventWriter {
    uint8_t* out;
    size_t cap;
    size_t at;
    bool put(const void* bytes, size_t n) {
        if (cap - at < n) return false;
        memcpy(out + at, bytes, n);
        at += n;
        return true;
    }
    bool put_type(uint8_t type) { return put(&type, 1); }
};

bool parse_int(const char* text, long long min, long long max, long long* value) {
    char* end;
    errno = 0;
    long long v = strtoll(text, &end, 0);
    if (errno != 0 || end == text || *end != '\0' || v < min || v > max) return false;
    *value = v;
    return true;
}

// One value at words[*i]; a list takes everything up to its "]".
bool put_value(EventWriter* w, const char* const* words, int count, int* i, int depth) {
    const char* word = words[*i];
    (*i)++;
    long long v;
    if (strcmp(word, "[") == 0) {
        if (depth > 8 || !w->put_type(EVENT_TYPE_LIST)) return false;
        size_t count_at = w->at;
        uint8_t items = 0;
        if (!w->put(&items, 1)) return false;
        while (*i < count && strcmp(words[*i], "]") != 0) {
            if (items == 255 || !put_value(w, words, count, i, depth + 1)) return false;
            items++;
        }
        if (*i == count) return false;  // no "]"
        (*i)++;
        w->out[count_at] = items;
        return true;
    }
    if (strncmp(word, "i:", 2) == 0 && parse_int(word + 2, INT32_MIN, UINT32_MAX, &v)) {
        int32_t value = static_cast<int32_t>(v);
        return w->put_type(EVENT_TYPE_INT) && w->put(&value, sizeof(value));
    }
    if (strncmp(word, "l:", 2) == 0 && parse_int(word + 2, INT64_MIN, INT64_MAX, &v)) {
        int64_t value = v;
        return w->put_type(EVENT_TYPE_LONG) && w->put(&value, sizeof(value));
    }
    if (strncmp(word, "f:", 2) == 0) {
        char* end;
        float value = strtof(word + 2, &end);
        return end != word + 2 && *end == '\0' && w->put_type(EVENT_TYPE_FLOAT) && w->put(&value, sizeof(value));
    }
    if (strncmp(word, "s:", 2) == 0) {
        size_t len = strlen(word + 2);
        if (len > LOGGER_MAX_PAYLOAD) return false;
        uint32_t len32 = static_cast<uint32_t>(len);
        return w->put_type(EVENT_TYPE_STRING) && w->put(&len32, sizeof(len32)) && w->put(word + 2, len);
    }
    return false;
}

}  // namespace

long logger_event_payload(int32_t tag, const char* const* words, int count, uint8_t* out, size_t cap) {
    EventWriter w = {out, cap, 0};
    if (!w.put(&tag, sizeof(tag))) return -1;
    int i = 0;
    if (count == 1 || (count > 0 && strcmp(words[0], "[") == 0)) {
        if (!put_value(&w, words, count, &i, 0) || i != count) return -1;
        return static_cast<long>(w.at);
    }
    // Several values: one list around them.
    if (!w.put_type(EVENT_TYPE_LIST)) return -1;
    size_t count_at = w.at;
    uint8_t items = 0;
    if (!w.put(&items, 1)) return -1;
    while (i < count) {
        if (items == 255 || !put_value(&w, words, count, &i, 1)) return -1;
        items++;
    }
    out[count_at] = items;
    return static_cast<long>(w.at);
}

int logger_write(const char* buffer, const void* payload, size_t n, const LoggerHeader* header) {
    if (header == nullptr) {
        char path[64] = LOGGER_DEVICE_DIR;
        if (logger_buffer_by_name(buffer) < 0) {
            errno = EINVAL;
            return 0;
        }
        strcat(path, buffer);
        UniqueFd fd(TEMP_FAILURE_RETRY(open(path, O_WRONLY | O_CLOEXEC)));
        return fd.ok() && TEMP_FAILURE_RETRY(write(fd.get(), payload, n)) >= 0 ? 1 : 0;
    }
    // Name, NUL, header, payload: one write, one entry.
    uint8_t bytes[16 + LOGGER_HEADER_LEN + LOGGER_MAX_PAYLOAD];
    size_t name_len = strlen(buffer) + 1;
    if (logger_buffer_by_name(buffer) < 0) {
        errno = EINVAL;
        return 0;
    }
    if (n > LOGGER_MAX_PAYLOAD) n = LOGGER_MAX_PAYLOAD;
    memcpy(bytes, buffer, name_len);
    memcpy(bytes + name_len, header, LOGGER_HEADER_LEN);
    memcpy(bytes + name_len + LOGGER_HEADER_LEN, payload, n);
    UniqueFd fd(TEMP_FAILURE_RETRY(open(LOGGER_INJECT_PATH, O_WRONLY | O_CLOEXEC)));
    return fd.ok() && TEMP_FAILURE_RETRY(write(fd.get(), bytes, name_len + LOGGER_HEADER_LEN + n)) >= 0 ? 1 : 0;
}
