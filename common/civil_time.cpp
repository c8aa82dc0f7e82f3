#include "common/civil_time.h"

// Howard Hinnant's civil-from-days algorithm.
void civil_time(long long t, struct tm* out) {
    long long days = t / 86400;
    long long secs = t % 86400;
    if (secs < 0) {
        secs += 86400;
        days -= 1;
    }
    long long z = days + 719468;
    long long era = (z >= 0 ? z : z - 146096) / 146097;
    long long doe = z - era * 146097;
    long long yoe = (doe - doe / 1460 + doe / 36524 - doe / 146096) / 365;
    long long doy = doe - (365 * yoe + yoe / 4 - yoe / 100);
    long long mp = (5 * doy + 2) / 153;
    out->tm_mday = static_cast<int>(doy - (153 * mp + 2) / 5 + 1);
    out->tm_mon = static_cast<int>(mp < 10 ? mp + 2 : mp - 10);
    out->tm_year = static_cast<int>(yoe + era * 400 + (out->tm_mon <= 1 ? 1 : 0) - 1900);
    out->tm_hour = static_cast<int>(secs / 3600);
    out->tm_min = static_cast<int>(secs / 60 % 60);
    out->tm_sec = static_cast<int>(secs % 60);
}
