// The emulated phone's kernel log as /proc/kmsg hands it out. The kernel keeps
// its log as records, one printk line each, and a read of /proc/kmsg returns
// as many whole records as fit in the reader's buffer; a record longer than
// the buffer goes out in pieces, the next read going on where the last one
// ended. There is one read position for all readers: what one takes, no other
// sees.
//
// The host feeds the log's text; every line becomes a record (a line longer
// than KMSG_RECORD_MAX, a kernel record's longest text, becomes several), and
// the unfinished end of the feed waits for the rest of its line until the
// feeder calls end_line. Records are kept until read: a full buffer takes no
// more feed (the feeder waits), where the kernel would drop its oldest lines.
#pragma once

#include <stddef.h>
#include <stdint.h>

constexpr size_t KMSG_RECORD_MAX = 1024;
constexpr size_t KMSG_BUFFER_SIZE = 256 * 1024;

class KmsgBuffer {
  public:
    // How many feed bytes take() accepts now.
    size_t room() const;
    // Takes n <= room() bytes of the log's text.
    void take(const char* bytes, size_t n);
    // The unfinished line so far becomes a record (the feed paused inside it).
    void end_line();
    bool line_open() const { return line_len_ > 0; }

    bool unread() const { return head_ != tail_; }
    // One read of up to size bytes into out: the bytes read, 0 when nothing is unread.
    size_t read(char* out, size_t size);

  private:
    void store(const char* text, size_t len);
    size_t record_len(uint64_t pos) const;
    void copy_in(uint64_t pos, const void* src, size_t n);
    void copy_out(uint64_t pos, void* dst, size_t n) const;

    // Records as a 2-byte length and the text, oldest at head_; positions are
    // byte counts since the start, taken modulo the buffer's size.
    uint8_t data_[KMSG_BUFFER_SIZE];
    uint64_t head_ = 0;
    uint64_t tail_ = 0;
    size_t partial_ = 0;  // bytes of the oldest record already read
    char line_[KMSG_RECORD_MAX];
    size_t line_len_ = 0;
};
