#include "platform/kmsg_buffer.h"

#include <string.h>

static constexpr size_t kLenBytes = 2;

size_t KmsgBuffer::room() const {
    // Every byte taken may end a record of its own, and the open line may too.
    size_t used = static_cast<size_t>(tail_ - head_) + line_len_ + kLenBytes;
    size_t free = used < KMSG_BUFFER_SIZE ? KMSG_BUFFER_SIZE - used : 0;
    return free / (1 + kLenBytes);
}

void KmsgBuffer::store(const char* text, size_t len) {
    uint8_t len_bytes[kLenBytes] = {static_cast<uint8_t>(len & 0xff), static_cast<uint8_t>(len >> 8)};
    for (size_t i = 0; i < kLenBytes + len; i++)
        data_[(tail_ + i) % KMSG_BUFFER_SIZE] = i < kLenBytes ? len_bytes[i] : static_cast<uint8_t>(text[i - kLenBytes]);
    tail_ += kLenBytes + len;
}

void KmsgBuffer::take(const char* bytes, size_t n) {
    for (size_t i = 0; i < n; i++) {
        line_[line_len_++] = bytes[i];
        if (bytes[i] == '\n' || line_len_ == KMSG_RECORD_MAX) end_line();
    }
}

void KmsgBuffer::end_line() {
    if (line_len_ == 0) return;
    store(line_, line_len_);
    line_len_ = 0;
}

size_t KmsgBuffer::record_len(uint64_t pos) const {
    return data_[pos % KMSG_BUFFER_SIZE] | static_cast<size_t>(data_[(pos + 1) % KMSG_BUFFER_SIZE]) << 8;
}

void KmsgBuffer::copy_out(uint64_t pos, char* dst, size_t n) const {
    for (size_t i = 0; i < n; i++) dst[i] = static_cast<char>(data_[(pos + i) % KMSG_BUFFER_SIZE]);
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
