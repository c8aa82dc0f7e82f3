// The merged timeline of one or more run folders: each run's held boots in
// the order they were recorded, then the run; within a section the lanes are
// merged by instant (on equal instants in the order of the run's files) and
// the lanes without instants follow. Entries are filtered as they are merged
// and handed to a sink one by one; nothing is loaded whole.
#pragma once

#include <functional>
#include <string>
#include <vector>

#include "tools/tavlolog/entry.h"
#include "tools/tavlolog/filter.h"

namespace tavlolog {

struct SectionInfo {
    std::string run, run_path;
    int boot = 0;
    std::string name;           // the held suffix, "" for the run
    bool kernel_timed = false;  // its kernel lines map to wall-clock instants
    bool same_boot = true;      // the boot of the run itself
};

class Sink {
  public:
    virtual ~Sink() = default;
    virtual void section(const SectionInfo&) {}
    virtual void entry(const Entry& e) = 0;
    // Following: nothing more for now (show what is buffered).
    virtual void idle() {}
};

struct FollowOptions {
    bool follow = false;
    int poll_ms = 200;
    // Asked between looks; following ends when it returns false.
    std::function<bool()> keep_going = [] { return true; };
};

// Reads the runs (folders as find_runs gives them) through the filter into the sink.
void read_timeline(const std::vector<std::string>& runs, const Filter& filter, Sink* sink,
                   const FollowOptions& follow = FollowOptions());
// The last instant the runs hold (for relative --since/--until), found from the
// ends of their files; 0 when none.
int64_t last_instant(const std::vector<std::string>& runs);

}  // namespace tavlolog
