// The reader side of "log_socket": one-byte log type, then plain log text.
#pragma once

#include "transist/transist_queue.h"

// Connections that have not sent their log type yet, at most.
constexpr int MAX_PENDING = 16;
// A connection that names no log type within this time is closed.
constexpr int PENDING_TIMEOUT_MS = 5000;
// At a stop the collectors have already ended: what is left in their
// connections arrives at once, so this bounds only stuck peers.
constexpr int STOP_DRAIN_MS = 300;

// Reads one chunk (at most READ_MAX bytes and a node block) from the type's connection fd into
// the fill queue. Returns 1 when a chunk was taken, 0 at end of stream or on a
// read error (both recorded), -1 when nothing is available yet. The count of
// bytes taken goes to *taken when given.
int read_log_message(int type, int fd, int* taken = nullptr);

// Small messages streaming in would cost the reader a wake-up and a read
// each. When data came less than GATHER_WINDOW_MS ago too and less than
// GATHER_LOW_WATER bytes wait, the reader lets more gather for at most
// GATHER_WAIT_MS (the writer writes once an interval anyway); a stop or a
// resume ends that wait at once.
constexpr int GATHER_LOW_WATER = 16384;
constexpr int GATHER_WAIT_MS = 5;
constexpr int GATHER_WINDOW_MS = 20;
// Reads of one connection per wake-up at most (64 KB), so that one busy
// stream cannot hold up the others, and the fill queue passes its high water
// by at most that much.
constexpr int READS_PER_WAKE = 65536 / READ_MAX;
