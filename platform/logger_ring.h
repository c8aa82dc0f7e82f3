// The emulated phone's legacy logger buffer: one ring of whole entries, each a
// 20-byte header (payload length, writer's pid and tid, time of the write)
// followed by its payload, as the phone's logger driver keeps them. Writers
// never wait: an entry that does not fit pushes out the oldest ones, whole.
// Readers keep their own position and catch up with the oldest kept entry
// when they fell behind.
//
// Positions are absolute byte counts since the ring was made, so a reader's
// position stays meaningful however often the ring wraps.
#pragma once

#include <stddef.h>
#include <stdint.h>
#include <sys/uio.h>

constexpr size_t LOGGER_HEADER_LEN = 20;
constexpr size_t LOGGER_MAX_PAYLOAD = 4076;
constexpr size_t LOGGER_MAX_ENTRY = LOGGER_HEADER_LEN + LOGGER_MAX_PAYLOAD;
constexpr size_t LOGGER_DEFAULT_SIZE = 256 * 1024;
constexpr size_t LOGGER_MIN_SIZE = LOGGER_MAX_ENTRY;
constexpr size_t LOGGER_MAX_SIZE = 64 * 1024 * 1024;

// The header as it lies in front of each entry (little-endian on every target).
struct LoggerHeader {
    uint16_t len;
    uint16_t pad;
    int32_t pid;
    int32_t tid;
    int32_t sec;
    int32_t nsec;
};
static_assert(sizeof(LoggerHeader) == LOGGER_HEADER_LEN, "logger header is 20 bytes");

// The buffers of the phone, in the order of their device numbers.
enum LoggerBuffer { LOGGER_MAIN = 0, LOGGER_SYSTEM, LOGGER_RADIO, LOGGER_EVENTS, LOGGER_BUFFER_COUNT };

// "main", "system", "radio", "events"; nullptr for anything else.
const char* logger_buffer_name(int buffer);
// The buffer of that name, or -1.
int logger_buffer_by_name(const char* name);

class LoggerRing {
  public:
    LoggerRing() = default;
    ~LoggerRing();
    LoggerRing(const LoggerRing&) = delete;
    LoggerRing& operator=(const LoggerRing&) = delete;

    // Allocates size bytes (LOGGER_MIN_SIZE to LOGGER_MAX_SIZE); 0 when the
    // size is out of range or memory is short.
    int init(size_t size);

    // Appends one entry whose header carries pid, tid, sec, nsec; the payload
    // is the bytes of iov, cut at LOGGER_MAX_PAYLOAD. Returns the payload
    // length kept (0 writes nothing).
    size_t append(const LoggerHeader& header, const struct iovec* iov, int iovcnt);

    uint64_t oldest() const { return head_; }
    uint64_t end() const { return tail_; }
    size_t size() const { return size_; }

    // A reader's position moved up to the oldest kept entry.
    uint64_t clamp(uint64_t pos) const { return pos < head_ ? head_ : pos; }
    // Header plus payload length of the entry at pos (pos must be a kept
    // entry's start, oldest() <= pos < end()).
    size_t entry_len(uint64_t pos) const;
    // Copies the entry at pos into out (entry_len(pos) bytes).
    void copy_entry(uint64_t pos, uint8_t* out) const;

  private:
    void copy_in(uint64_t pos, const void* src, size_t n);
    void copy_out(uint64_t pos, void* dst, size_t n) const;

    uint8_t* data_ = nullptr;
    size_t size_ = 0;
    uint64_t head_ = 0;  // start of the oldest kept entry
    uint64_t tail_ = 0;  // where the next entry goes
};

// The write path of a device: one write (or writev) of a process appends one
// entry stamped with the writer's pid and tid and the time. Returns the bytes
// taken (the payload, cut at LOGGER_MAX_PAYLOAD).
size_t logger_device_write(LoggerRing* ring, int32_t pid, int32_t tid, const struct timespec& now,
                           const void* bytes, size_t n);

// The write path of the injection file, through which the phone's root puts an
// entry with a header of its choice into a buffer (for exact time-ordering
// cases): the buffer's name and a NUL, the 20-byte header (its length field is
// ignored: the payload's length counts), then the payload. Returns the bytes
// taken, or -1 (nothing appended) when the name is unknown or the header
// incomplete.
long logger_inject_write(LoggerRing* const rings[LOGGER_BUFFER_COUNT], const void* bytes, size_t n);
