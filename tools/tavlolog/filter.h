// The filters that choose entries while they are merged: time, priority, tag,
// pid, a regular expression on the message, source and boot. They combine:
// an entry is shown when it passes every filter given.
#pragma once

#include <regex.h>

#include <cstdint>
#include <string>
#include <vector>

#include "tools/tavlolog/entry.h"

namespace tavlolog {

// A --since or --until value.
struct TimeArg {
    enum Kind { NONE, INSTANT, LOCAL, RELATIVE } kind = NONE;
    int64_t ns = 0;  // since the epoch (INSTANT), a local time as if UTC (LOCAL), or from the end (RELATIVE)
};
// "2026-03-04 07:06:49[.123]" (the phone's own local time), with "T" and a
// zone ("Z", "+01:00") an instant, "@SECONDS" an instant, "-10min", "-2h",
// "-30s", "-1d" from the end of the run. false when it is none of them.
bool parse_time_arg(const char* text, TimeArg* out);
// "E", "w", "3", "err", "warning", or a range "E..I": the priorities shown.
bool parse_priority(const char* text, int* most_severe, int* least_severe);
// "KMS", "k,m" or "kernel,main,system,radio,events,bt": a mask of sources.
bool parse_sources(const char* text, unsigned* mask);

class Filter {
  public:
    Filter() = default;
    ~Filter();
    Filter(const Filter&) = delete;
    Filter& operator=(const Filter&) = delete;

    TimeArg since, until;
    int prio_min = 0, prio_max = PRIO_VERBOSE;
    bool has_priority = false;
    std::vector<std::string> tags;
    std::vector<int32_t> pids;
    unsigned sources = (1u << SRC_COUNT) - 1;
    bool has_boot = false;
    int boot = 0;           // when boot_name is empty
    std::string boot_name;  // "run" is the run itself

    // The regular expression (POSIX extended; without capitals it ignores case).
    bool set_grep(const char* pattern, std::string* error);
    // Relative times are counted from end_ns, the last instant of the runs.
    void resolve(int64_t end_ns);
    bool needs_end() const { return since.kind == TimeArg::RELATIVE || until.kind == TimeArg::RELATIVE; }
    bool boot_wanted(int boot_number, const std::string& name) const;
    bool match(const Entry& e) const;

  private:
    bool has_grep_ = false;
    regex_t grep_{};
    mutable std::string scratch_;
};

}  // namespace tavlolog
