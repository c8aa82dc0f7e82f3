#include "platform/kmsg_buffer.h"

#include <string.h>

static constexpr size_t kLenBytes = 2;

size_t KmsgBuffer::room() const {
    // Every byte taken may end a record of its own, and the open line may too.
    size_t used = static_cast<size_t>(tail_ - head_) + line_len_ + kLenBytes;
    size_t left = used < KMSG_BUFFER_SIZE ? KMSG_BUFFER_SIZE - used : 0;
    return left / (1 + kLenBytes);
}

void KmsgBuffer::copy_in(uint64_t pos, const void* src, size_t n) {
    size_t at = static_cast<size_t>(pos % KMSG_BUFFER_SIZE);
    size_t first = n < KMSG_BUFFER_SIZE - at ? n : KMSG_BUFFER_SIZE - at;
    memcpy(data_ + at, src, first);
    memcpy(data_, static_cast<const uint8_t*>(src) + first, n - first);
}

void KmsgBuffer::copy_out(uint64_t pos, void* dst, size_t n) const {
    size_t at = static_cast<size_t>(pos % KMSG_BUFFER_SIZE);
    size_t first = n < KMSG_BUFFER_SIZE - at ? n : KMSG_BUFFER_SIZE - at;
    memcpy(dst, data_ + at, first);
    memcpy(static_cast<uint8_t*>(dst) + first, data_, n - first);
}

void KmsgBuffer::store(const char* text, size_t len) {
    uint8_t len_bytes[kLenBytes] = {static_cast<uint8_t>(len & 0xff), static_cast<uint8_t>(len >> 8)};
    copy_in(tail_, len_bytes, kLenBytes);
    copy_in(tail_ + kLenBytes, text, len);
    tail_ += kLenBytes + len;
}

void KmsgBuffer::take(const char* bytes, size_t n) {
    while (n > 0) {
        size_t space = KMSG_RECORD_MAX - line_len_, span = n < space ? n : space;
        const char* nl = static_cast<const char*>(memchr(bytes, '\n', span));
        size_t part = nl != nullptr ? static_cast<size_t>(nl - bytes) + 1 : span;
        memcpy(line_ + line_len_, bytes, part);
        line_len_ += part;
        if (nl != nullptr || line_len_ == KMSG_RECORD_MAX) end_line();
        bytes += part;
        n -= part;
    }
}

void KmsgBuffer::end_line() {
    if (line_len_ == 0) return;
    store(line_, line_len_);
    line_len_ = 0;
}

size_t KmsgBuffer::record_len(uint64_t pos) const {
    uint8_t len_bytes[kLenBytes];
    copy_out(pos, len_bytes, kLenBytes);
    return len_bytes[0] | static_cast<size_t>(len_bytes[1]) << 8;
}

size_t KmsgBuffer::read(char* out, size_t size) {
    size_t done = 0;
    while (head_ != tail_) {
        size_t len = record_len(head_), rest = len - partial_;
        uint64_t text = head_ + kLenBytes + partial_;
        if (rest <= size - done) {
            copy_out(text, out + done, rest);
            done += rest;
            head_ += kLenBytes + len;
            partial_ = 0;
        } else {
            // Only a read that would otherwise return nothing takes part of a record.
            if (done == 0) {
                copy_out(text, out, size);
                partial_ += size;
                done = size;
            }
            break;
        }
    }
    return done;
}
