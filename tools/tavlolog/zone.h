// The rules of a named time zone from the system's zone data: the offset of a
// local time (the phone's threadtime lines) and of an instant (kernel lines).
// Each lookup is cached for its hour, so a zone costs a system call only when
// the hour changes.
#pragma once

#include <cstdint>
#include <string>

namespace tavlolog {

class Zone {
  public:
    // A zone the host does not know (or no name) is UTC; known() tells.
    explicit Zone(const std::string& name);
    bool known() const { return known_; }
    const std::string& name() const { return name_; }
    // Seconds east of UTC in force at the local time / at the instant (both in
    // seconds since the epoch; the local one as if it were UTC).
    int32_t offset_of_local(int64_t local_s);
    int32_t offset_of_instant(int64_t utc_s);

  private:
    void select() const;
    std::string name_;
    bool known_ = false;
    int64_t local_hour_ = INT64_MIN, utc_hour_ = INT64_MIN;
    int32_t local_offset_ = 0, utc_offset_ = 0;
};

// Whether the system's zone data holds the zone (TZDIR, else /usr/share/zoneinfo).
bool zone_known(const std::string& name);

}  // namespace tavlolog
