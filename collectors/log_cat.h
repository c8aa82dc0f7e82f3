// LogCat: the Android log collector. Reads whole entries from its logger
// devices (main with system, radio, or events), merges them in time order and
// sends each as one "threadtime" line of the platform log library to the
// transist as stream "M", "R" or "E".
#pragma once

#include <stddef.h>

#include <log/logprint.h>

#include "collectors/collector_link.h"
#include "collectors/flood_guard.h"
#include "collectors/log_device.h"

// More queued entries than this and the collector is overloaded: it stops
// holding entries back for ordering.
constexpr int OVERLOAD_THRESHOLD = 9999;
// The same when the held entries take more bytes than this: any app can write
// entries of the longest payload, and 10,000 of those would take 40 MB.
constexpr size_t OVERLOAD_BYTES = 4 << 20;

class LogCat : public CollectorLink {
  public:
    // name is the collector name ("main_log", "radio_log", "events_log"),
    // which gives the stream letter.
    explicit LogCat(const char* name);
    // The collector process ends without destroying it; tests and the
    // benchmark, which run the engine in place, release what it holds.
    ~LogCat() override;

    // Runs in the collector child: device null for main (with system when
    // present), else "radio" or "events". Never returns.
    [[noreturn]] void run(const char* name, const char* device, int shm_fd);

    // Folder of the logger devices; tests point it elsewhere.
    static const char* device_root;

    // --- the engine, driven by the loop and, in tests, from memory ---

    // Appends a device to the list (path copied). Returns it, or null when
    // memory is short.
    LogDevice* add_device(const char* path, bool binary, log_id_t log_id, int fd);
    // Selects "threadtime"; 0 when the library does not know it.
    int set_output_format();
    // Queues one entry's bytes as read from device. Returns 1, or 0 when they
    // were not a whole entry (dropped), memory is short, or the writer is past
    // its budget (flood; counted there).
    int take_entry(LogDevice* device, const char* raw, size_t n);
    // Sends the summary lines of the flood drops that are due (all of them
    // when `all`), each a "threadtime" line of the collector's own.
    void report_drops(bool all);
    // After a pass that read data: sends what is safe to send, holding back
    // an entry that is alone in its device's queue (an older one of another
    // device may still be unread) unless the collector is overloaded.
    void print_ready();
    // Sends everything queued, oldest first, and every rendered line.
    void print_all();
    // Lines go out in batches of up to 16 KB, one send each: a stream costs a
    // send per batch rather than per line. Sends the batch so far.
    void flush_output();
    // The reading loop over the open devices; never returns.
    [[noreturn]] void read_log_lines();

    LogDevice* devices = nullptr;
    int device_count = 0;
    int queued_count = 0;
    size_t queued_bytes = 0;  // blocks of the queued entries, headers included
    bool overloaded = false;
    EventTagMap* event_tag_map = nullptr;
    FloodGuard flood;  // off unless PROP_PID_BUDGET is set

  private:
    void print_next_entry(LogDevice* device);
    void drop_next_entry(LogDevice* device);
    void print_start_marker(LogDevice* device);
    void push_marker_entry(LogDevice* device);
    void format_and_send(const AndroidLogEntry& line);
    void append_output(const char* text, size_t len);
    void queue(LogDevice* device, QueuedEntry* entry);
    // Reads one entry of device: 1 queued, 0 nothing now (EAGAIN or EINTR, in
    // *interrupted), never returns on a read failure or end of stream.
    int read_entry(LogDevice* device, bool* interrupted);
    // What was read is sent before the collector ends.
    [[noreturn]] void finish(int status, int reason);
    // Asked to stop: takes what the devices hold now, sends it all, ends.
    [[noreturn]] void finish_at_stop(int reason);

    AndroidLogFormat* format = nullptr;
    char event_text[1024];  // decoded binary values
    char event_tag[64];     // an event's tag name from the tag map
    char output[16384];     // rendered lines not sent yet
    size_t output_len = 0;
    bool marker_queued = false;  // this overload's marker is queued (or sent)
};
