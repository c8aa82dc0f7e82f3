// What a run folder holds: its name's date, the boot's wall-clock start that
// the run's properties record, and its sections (the held pieces of earlier
// boots by suffix, then the run itself) each with one lane per log type.
#pragma once

#include <cstdint>
#include <string>
#include <vector>

#include "tools/tavlolog/entry.h"

namespace tavlolog {

// The system property the daemon sets at every run start and folder switch:
// "SECONDS.NANOS", the wall-clock time at which the boot clock read zero.
constexpr char kBootWallclockProperty[] = "debug.TQ.boot_wallclock";

struct LogType {
    const char* name;
    Source source;
};
// The run's files in the order they are merged on equal instants.
extern const LogType kLogTypes[5];

struct Piece {
    std::string path;  // full path
    std::string name;  // within the run folder, as shown
};

struct LaneFiles {
    Source source;
    std::string base_path;      // the current file of the run's lane ("" for held pieces)
    std::vector<Piece> pieces;  // oldest first
};

struct SectionFiles {
    int boot = 0;          // 0 the run, -1 the held boot before it, ...
    std::string name;      // the held suffix ("boot", "hbr", ...), "" for the run
    bool same_boot = true;  // the run's boot (its kernel times map to the recorded start)
    std::vector<LaneFiles> lanes;
};

struct RunFolder {
    std::string path;  // the folder, with a trailing '/'
    std::string name;  // its last component
    bool has_date = false;
    int64_t folder_days = 0;  // the date in its name, as days since the epoch
    bool has_boot_wallclock = false;
    int64_t boot_wallclock_ns = 0;
    std::vector<SectionFiles> sections;  // held sections unordered; the run last
};

// Reads the folder's listing and properties; false (warned) when it cannot be listed.
bool scan_run(const std::string& path, RunFolder* run);
// The run folders the paths name (a run folder, or a folder of them such as
// qrvlog/tavlolog/), in the order of the time in their names.
std::vector<std::string> find_runs(const std::vector<std::string>& paths);
// A run folder's name (APLog_%Y_%m%d_%H%M%S or BOOTFAIL_...): its date.
bool date_of_run_name(const std::string& name, int* year, int* month, int* day);
// "SECONDS.NANOS" as nanoseconds; false when it is not that.
bool parse_wallclock(const std::string& text, int64_t* ns);
// Whether a held suffix names the logs of the run's own boot.
bool same_boot_suffix(const std::string& suffix);
// The rank of a held suffix among boots whose order the logs do not tell.
int held_rank(const std::string& suffix);

}  // namespace tavlolog
