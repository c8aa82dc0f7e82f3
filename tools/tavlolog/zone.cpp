#include "tools/tavlolog/zone.h"

#include <stdlib.h>
#include <sys/stat.h>
#include <time.h>

namespace tavlolog {

namespace {

// The zone the C library's local time functions now follow.
std::string g_selected;
bool g_any_selected = false;

}  // namespace

bool zone_known(const std::string& name) {
    if (name.empty() || name[0] == '/' || name.find("..") != std::string::npos) return false;
    const char* dir = getenv("TZDIR");
    std::string path = std::string(dir != nullptr && *dir ? dir : "/usr/share/zoneinfo") + "/" + name;
    struct stat st;
    return stat(path.c_str(), &st) == 0 && S_ISREG(st.st_mode);
}

Zone::Zone(const std::string& name) : name_(name), known_(zone_known(name)) {}

void Zone::select() const {
    if (g_any_selected && g_selected == name_) return;
    // ":name" reads the zone file; an unknown zone is taken as UTC.
    setenv("TZ", known_ ? (":" + name_).c_str() : "UTC0", 1);
    tzset();
    g_selected = name_;
    g_any_selected = true;
}

int32_t Zone::offset_of_local(int64_t local_s) {
    if (!known_) return 0;
    int64_t hour = local_s >= 0 ? local_s / 3600 : (local_s - 3599) / 3600;
    if (hour == local_hour_) return local_offset_;
    select();
    time_t t = static_cast<time_t>(local_s);
    struct tm tm;
    gmtime_r(&t, &tm);
    tm.tm_isdst = -1;
    time_t utc = mktime(&tm);
    local_offset_ = utc == static_cast<time_t>(-1) ? 0 : static_cast<int32_t>(local_s - utc);
    // In a skipped hour (spring forward) mktime moves the time; the offset is
    // still the one before or after the change, as the phone would have had.
    local_hour_ = hour;
    return local_offset_;
}

int32_t Zone::offset_of_instant(int64_t utc_s) {
    if (!known_) return 0;
    int64_t hour = utc_s >= 0 ? utc_s / 3600 : (utc_s - 3599) / 3600;
    if (hour == utc_hour_) return utc_offset_;
    select();
    time_t t = static_cast<time_t>(utc_s);
    struct tm tm;
    localtime_r(&t, &tm);
    utc_offset_ = static_cast<int32_t>(tm.tm_gmtoff);
    utc_hour_ = hour;
    return utc_offset_;
}

}  // namespace tavlolog
