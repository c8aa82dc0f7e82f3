#include "tools/tavlolog/timeline.h"

#include <sys/stat.h>
#include <unistd.h>

#include <algorithm>
#include <memory>

#include "tools/tavlolog/lane.h"
#include "tools/tavlolog/run_folder.h"
#include "tools/tavlolog/warnings.h"

namespace tavlolog {

namespace {

constexpr int kProbeEntries = 2000;  // looked at to find where a held boot begins

using Lanes = std::vector<std::unique_ptr<Lane>>;

LaneContext context_for(const RunFolder& run, const SectionFiles& section) {
    LaneContext c;
    c.run_name = run.name;
    c.run_path = run.path;
    c.has_date = run.has_date;
    c.folder_days = run.folder_days;
    c.has_boot_wallclock = run.has_boot_wallclock && section.same_boot;
    c.boot_wallclock_ns = run.boot_wallclock_ns;
    c.boot = section.boot;
    c.boot_name = section.name;
    return c;
}

// The first own instant of a section's lines, INT64_MAX when none has one.
int64_t first_instant(const RunFolder& run, const SectionFiles& section) {
    LaneContext context = context_for(run, section);
    int64_t first = INT64_MAX;
    for (const LaneFiles& files : section.lanes) {
        Lane lane(files, &context);
        if (lane.untimed()) continue;
        for (int i = 0; i < kProbeEntries && lane.next(); i++) {
            const Entry& e = lane.entry();
            if (e.has_instant && !e.inherited) {
                first = std::min(first, e.instant_ns);
                break;
            }
        }
    }
    return first;
}

// Held boots oldest first (by their first instant; boots without one by their
// kind), numbered back from the run: the last held boot is -1.
void order_sections(RunFolder* run) {
    std::vector<SectionFiles>& s = run->sections;
    size_t held = s.size() - 1;
    std::vector<std::pair<int64_t, int>> keys(held);
    for (size_t i = 0; i < held; i++) keys[i] = {first_instant(*run, s[i]), held_rank(s[i].name)};
    std::vector<size_t> order(held);
    for (size_t i = 0; i < held; i++) order[i] = i;
    std::stable_sort(order.begin(), order.end(), [&](size_t a, size_t b) {
        bool ta = keys[a].first != INT64_MAX, tb = keys[b].first != INT64_MAX;
        if (ta && tb) return keys[a].first < keys[b].first;
        if (ta != tb) return tb;  // a boot that tells no time: before those that do
        return keys[a].second < keys[b].second;
    });
    std::vector<SectionFiles> sorted;
    for (size_t i : order) sorted.push_back(s[i]);
    sorted.push_back(s.back());
    for (size_t i = 0; i < held; i++) sorted[i].boot = static_cast<int>(i) - static_cast<int>(held);
    s.swap(sorted);
}

class Merger {
  public:
    Merger(const Filter& filter, Sink* sink) : filter_(filter), sink_(sink) {}

    // A section is announced with its first entry that passes the filters.
    void begin(const SectionInfo& info) {
        section_ = info;
        announced_ = false;
    }

    // Emits everything the lanes hold now, in order.
    void drain(Lanes& lanes) {
        size_t n = lanes.size();
        has_.assign(n, 0);
        timed_.assign(n, 0);
        for (size_t i = 0; i < n; i++) {
            has_[i] = lanes[i]->next();
            timed_[i] = !lanes[i]->untimed();
        }
        for (;;) {
            int best = -1;
            int64_t best_key = 0;
            for (size_t i = 0; i < n; i++) {
                if (!has_[i] || !timed_[i]) continue;
                // Strictly earlier only: equal instants keep the order of the run's files.
                int64_t key = lanes[i]->key();
                if (best < 0 || key < best_key) {
                    best = static_cast<int>(i);
                    best_key = key;
                }
            }
            for (size_t i = 0; i < n && best < 0; i++)
                if (has_[i]) best = static_cast<int>(i);
            if (best < 0) return;
            const Entry& e = lanes[best]->entry();
            if (filter_.match(e)) {
                if (!announced_) sink_->section(section_);
                announced_ = true;
                sink_->entry(e);
            }
            // A lane that has nothing more is not asked again in this pass.
            has_[best] = lanes[best]->next();
        }
    }

  private:
    const Filter& filter_;
    Sink* sink_;
    std::vector<char> has_, timed_;
    SectionInfo section_;
    bool announced_ = true;
};

// The section's lanes in the order of the run's files.
void open_lanes(const SectionFiles& section, const LaneContext* context, Lanes* lanes) {
    std::vector<const LaneFiles*> lane_files;
    for (const LaneFiles& files : section.lanes) lane_files.push_back(&files);
    std::stable_sort(lane_files.begin(), lane_files.end(),
                     [](const LaneFiles* a, const LaneFiles* b) { return a->source < b->source; });
    for (const LaneFiles* files : lane_files) lanes->push_back(std::unique_ptr<Lane>(new Lane(*files, context)));
}

std::string parent_of(const std::string& run_path) {
    std::string t = run_path.substr(0, run_path.size() - 1);
    size_t slash = t.rfind('/');
    return slash == std::string::npos ? "./" : t.substr(0, slash + 1);
}

// Reads one run; when following, its run section stays open in `live`.
void read_run(const std::string& path, const Filter& filter, Merger* merger, bool follow,
              Lanes* live, std::unique_ptr<LaneContext>* live_context) {
    RunFolder run;
    if (!scan_run(path, &run)) return;
    order_sections(&run);
    for (const SectionFiles& section : run.sections) {
        if (!filter.boot_wanted(section.boot, section.name)) continue;
        std::unique_ptr<LaneContext> context(new LaneContext(context_for(run, section)));
        bool kernel_lines = false;
        for (const LaneFiles& l : section.lanes) kernel_lines |= l.source == SRC_KERNEL && !l.pieces.empty();
        if (kernel_lines && !context->has_boot_wallclock) {
            std::string which = section.name.empty() ? "" : " of the held boot \"" + section.name + "\"";
            warn("%s: kernel lines%s are shown after the others, with their time since boot: %s", run.path.c_str(),
                 which.c_str(),
                 section.same_boot ? "the run does not record when its boot began"
                                   : "that boot's start is not recorded");
        }
        SectionInfo info{run.name, run.path, section.boot, section.name, context->has_boot_wallclock, section.same_boot};
        merger->begin(info);
        Lanes lanes;
        open_lanes(section, context.get(), &lanes);
        bool stays = follow && section.boot == 0;
        if (stays)
            for (auto& lane : lanes) lane->follow();
        merger->drain(lanes);
        if (stays) {
            live->swap(lanes);
            live_context->swap(context);
        }
    }
}

// A run folder named later than `current` beside it, or "".
std::string newer_run(const std::string& current) {
    std::vector<std::string> runs = find_runs({parent_of(current)});
    return !runs.empty() && runs.back() != current && runs.back() > current ? runs.back() : std::string();
}

}  // namespace

void read_timeline(const std::vector<std::string>& runs, const Filter& filter, Sink* sink,
                   const FollowOptions& follow) {
    Merger merger(filter, sink);
    Lanes live;
    std::unique_ptr<LaneContext> live_context;
    for (size_t i = 0; i < runs.size(); i++)
        read_run(runs[i], filter, &merger, follow.follow && i + 1 == runs.size(), &live, &live_context);
    if (!follow.follow || runs.empty()) return;
    std::string current = runs.back();
    int looks = 0;
    while (follow.keep_going()) {
        sink->idle();
        usleep(static_cast<useconds_t>(follow.poll_ms) * 1000);
        for (auto& lane : live) lane->poll();
        merger.drain(live);
        // Once a second: has this run ended and another begun beside it?
        if (++looks * follow.poll_ms < 1000) continue;
        looks = 0;
        std::string next = newer_run(current);
        if (next.empty()) continue;
        for (auto& lane : live) lane->poll();
        merger.drain(live);
        warn("%s ended; following %s", current.c_str(), next.c_str());
        live.clear();
        current = next;
        read_run(current, filter, &merger, true, &live, &live_context);
    }
    sink->idle();
}

int64_t last_instant(const std::vector<std::string>& runs) {
    // Read wholly but without output: simple, and still a streaming pass.
    struct Last : Sink {
        int64_t last = 0;
        void entry(const Entry& e) override {
            if (e.has_instant && e.instant_ns > last) last = e.instant_ns;
        }
    } sink;
    Filter all;
    read_timeline(runs, all, &sink);
    return sink.last;
}

}  // namespace tavlolog
