#include "platform/logger_ring.h"

#include <stdlib.h>
#include <string.h>
#include <time.h>

static const char* const kBufferNames[LOGGER_BUFFER_COUNT] = {"main", "system", "radio", "events"};

const char* logger_buffer_name(int buffer) {
    return buffer >= 0 && buffer < LOGGER_BUFFER_COUNT ? kBufferNames[buffer] : nullptr;
}

int logger_buffer_by_name(const char* name) {
    for (int i = 0; i < LOGGER_BUFFER_COUNT; i++)
        if (strcmp(name, kBufferNames[i]) == 0) return i;
    return -1;
}

LoggerRing::~LoggerRing() { free(data_); }

int LoggerRing::init(size_t size) {
    if (size < LOGGER_MIN_SIZE || size > LOGGER_MAX_SIZE || data_ != nullptr) return 0;
    data_ = static_cast<uint8_t*>(malloc(size));
    if (data_ == nullptr) return 0;
    size_ = size;
    return 1;
}

void LoggerRing::copy_in(uint64_t pos, const void* src, size_t n) {
    size_t at = static_cast<size_t>(pos % size_);
    size_t first = n < size_ - at ? n : size_ - at;
    memcpy(data_ + at, src, first);
    memcpy(data_, static_cast<const uint8_t*>(src) + first, n - first);
}

void LoggerRing::copy_out(uint64_t pos, void* dst, size_t n) const {
    size_t at = static_cast<size_t>(pos % size_);
    size_t first = n < size_ - at ? n : size_ - at;
    memcpy(dst, data_ + at, first);
    memcpy(static_cast<uint8_t*>(dst) + first, data_, n - first);
}

size_t LoggerRing::entry_len(uint64_t pos) const {
    uint16_t len;
    copy_out(pos, &len, sizeof(len));
    return LOGGER_HEADER_LEN + len;
}

void LoggerRing::copy_entry(uint64_t pos, uint8_t* out) const { copy_out(pos, out, entry_len(pos)); }

size_t LoggerRing::append(const LoggerHeader& header, const struct iovec* iov, int iovcnt) {
    size_t len = 0;
    for (int i = 0; i < iovcnt && len < LOGGER_MAX_PAYLOAD; i++) {
        size_t room = LOGGER_MAX_PAYLOAD - len;
        len += iov[i].iov_len < room ? iov[i].iov_len : room;
    }
    if (len == 0 || data_ == nullptr) return 0;
    size_t need = LOGGER_HEADER_LEN + len;
    // Push out whole entries until the new one fits; readers still on them
    // move up when they next look (clamp).
    while (tail_ + need - head_ > size_) head_ += entry_len(head_);

    LoggerHeader h = header;
    h.len = static_cast<uint16_t>(len);
    h.pad = 0;
    copy_in(tail_, &h, sizeof(h));
    uint64_t pos = tail_ + LOGGER_HEADER_LEN;
    size_t left = len;
    for (int i = 0; i < iovcnt && left > 0; i++) {
        size_t n = iov[i].iov_len < left ? iov[i].iov_len : left;
        copy_in(pos, iov[i].iov_base, n);
        pos += n;
        left -= n;
    }
    tail_ += need;
    return len;
}

size_t logger_device_write(LoggerRing* ring, int32_t pid, int32_t tid, const struct timespec& now,
                           const void* bytes, size_t n) {
    LoggerHeader header = {};
    header.pid = pid;
    header.tid = tid;
    // The entry keeps 32-bit seconds, as on the phone.
    header.sec = static_cast<int32_t>(now.tv_sec);
    header.nsec = static_cast<int32_t>(now.tv_nsec);
    struct iovec iov = {const_cast<void*>(bytes), n};
    return ring->append(header, &iov, 1);
}

long logger_inject_write(LoggerRing* const rings[LOGGER_BUFFER_COUNT], const void* bytes, size_t n) {
    const char* text = static_cast<const char*>(bytes);
    const char* nul = static_cast<const char*>(memchr(text, '\0', n < 16 ? n : 16));
    if (nul == nullptr) return -1;
    int buffer = logger_buffer_by_name(text);
    if (buffer < 0 || rings[buffer] == nullptr) return -1;
    size_t at = static_cast<size_t>(nul - text) + 1;
    if (n - at < LOGGER_HEADER_LEN) return -1;
    LoggerHeader header;
    memcpy(&header, text + at, sizeof(header));
    at += LOGGER_HEADER_LEN;
    struct iovec iov = {const_cast<char*>(text + at), n - at};
    size_t kept = rings[buffer]->append(header, &iov, 1);
    return static_cast<long>(at + kept);
}
