// --summary: what a run holds at a glance, from one pass over the merged
// timeline. Counts are kept per source and priority; tags and pids in maps
// bounded in size; findings (overload markers, problem signatures, gaps) are
// listed up to a limit each and counted beyond it.
#include <algorithm>
#include <cstring>
#include <map>
#include <unordered_map>
#include <vector>

#include "tools/tavlolog/line_parse.h"
#include "tools/tavlolog/output.h"
#include "tools/tavlolog/signatures.h"

namespace tavlolog {

namespace {

constexpr size_t kMaxKeys = 100000;   // distinct tags or pids counted; the rest as "others"
constexpr size_t kMaxListed = 20;     // findings listed per kind
constexpr size_t kTop = 10;
constexpr size_t kContext = 160;      // characters of a finding's line
constexpr int kPrioColumns = PRIO_VERBOSE + 2;  // 0..8 and none

struct Finding {
    int64_t instant;
    bool has_instant;
    int32_t offset;
    std::string where, line;
};

struct FindingList {
    std::vector<Finding> listed;
    uint64_t count = 0;
};

struct SectionCount {
    SectionInfo info;
    uint64_t entries = 0;
    bool any = false;
    int64_t first = 0, last = 0;
    int32_t offset = 0;
};

class Summary : public Sink {
  public:
    Summary(FILE* out, int64_t gap_s) : out_(out), gap_ns_(gap_s * 1000000000) {}
    ~Summary() override { write(); }

    void section(const SectionInfo& s) override {
        // Between two boots of one run's folder that are not both the run's own
        // boot, the phone restarted.
        if (!sections_.empty() && sections_.back().info.run == s.run &&
            !(sections_.back().info.same_boot && s.same_boot)) {
            std::string from = sections_.back().info.boot == 0 ? "the run" : "held boot \"" + sections_.back().info.name + "\"";
            std::string to = s.boot == 0 ? "the run" : "held boot \"" + s.name + "\"";
            Finding f{sections_.back().last, sections_.back().any, sections_.back().offset, s.run,
                      "the phone restarted between " + from + " and " + to};
            add(&findings_["reboot between held boots"], f);
        }
        sections_.push_back(SectionCount{s});
        last_ = INT64_MIN;
    }

    void entry(const Entry& e) override {
        Source src = e.source;
        counts_[src][e.priority == PRIO_NONE ? kPrioColumns - 1 : e.priority]++;
        if (!sections_.empty()) {
            SectionCount& s = sections_.back();
            s.entries++;
            if (e.has_instant) {
                if (!s.any) s.first = e.instant_ns;
                s.any = true;
                s.last = e.instant_ns;
                s.offset = e.utc_offset_s;
            }
        }
        if (e.has_instant) {
            Span& span = spans_[src];
            if (!span.any || e.instant_ns < span.first) span.first = e.instant_ns;
            if (!span.any || e.instant_ns > span.last) span.last = e.instant_ns;
            span.any = true;
            span.offset = e.utc_offset_s;
            if (last_ != INT64_MIN && e.instant_ns - last_ > gap_ns_) {
                Finding f = finding(e);
                f.line = "no entry for " + std::to_string((e.instant_ns - last_) / 1000000000) + " s before: " +
                         f.line;
                add(&gaps_, f);
            }
            if (e.instant_ns > last_) last_ = e.instant_ns;
        }
        if (e.kind != KIND_LINE) return;
        if (!e.tag.empty()) bump(&tags_, std::string(e.tag), &other_tags_);
        if (e.pid >= 0) bump(&pids_, e.pid, &other_pids_);
        if (is_overload_marker(e)) add(&overload_, finding(e));
        for (const Signature& sig : kSignatures) {
            if (!(sig.sources & (1u << src))) continue;
            if (sig.tag != nullptr && e.tag != sig.tag) continue;
            if (memmem(e.message.data(), e.message.size(), sig.text, strlen(sig.text)) == nullptr) continue;
            add(&findings_[sig.problem], finding(e));
            break;
        }
    }

  private:
    struct Span {
        bool any = false;
        int64_t first = 0, last = 0;
        int32_t offset = 0;
    };

    template <class Map, class Key>
    static void bump(Map* map, const Key& key, uint64_t* others) {
        auto it = map->find(key);
        if (it != map->end()) {
            it->second++;
        } else if (map->size() < kMaxKeys) {
            (*map)[key] = 1;
        } else {
            (*others)++;
        }
    }

    static void add(FindingList* list, const Finding& f) {
        if (list->listed.size() < kMaxListed) list->listed.push_back(f);
        list->count++;
    }

    Finding finding(const Entry& e) {
        Finding f{e.instant_ns, e.has_instant, e.utc_offset_s, {}, {}};
        f.where = std::string(e.run) + "/" + std::string(e.file) + "@" + std::to_string(e.offset);
        std::string line = std::string(1, SOURCE_LETTER[e.source]) + " ";
        if (!e.tag.empty()) line += std::string(e.tag) + ": ";
        line += std::string(e.message.substr(0, kContext));
        for (char& c : line)
            if (static_cast<unsigned char>(c) < 0x20 || c == 0x7f) c = '?';
        f.line = line;
        return f;
    }

    std::string when(int64_t instant, bool has, int32_t offset) {
        if (!has) return std::string(26, ' ');
        std::string t;
        time_.local(t, instant, offset, ' ', 6);
        return t;
    }

    void list(const char* title, const FindingList& l) {
        fprintf(out_, "\n%s: %llu\n", title, static_cast<unsigned long long>(l.count));
        for (const Finding& f : l.listed)
            fprintf(out_, "  %s  %s\n  %26s  (%s)\n", when(f.instant, f.has_instant, f.offset).c_str(), f.line.c_str(),
                    "", f.where.c_str());
        if (l.count > l.listed.size())
            fprintf(out_, "  ... and %llu more\n", static_cast<unsigned long long>(l.count - l.listed.size()));
    }

    template <class Map>
    void top(const char* title, const Map& map, uint64_t others) {
        std::vector<std::pair<uint64_t, std::string>> v;
        for (const auto& kv : map) {
            std::string key;
            if constexpr (std::is_same<typename Map::key_type, std::string>::value) key = kv.first;
            else key = std::to_string(kv.first);
            v.push_back({kv.second, key});
        }
        size_t n = std::min(kTop, v.size());
        std::partial_sort(v.begin(), v.begin() + static_cast<long>(n), v.end(),
                          [](const auto& a, const auto& b) { return a.first > b.first || (a.first == b.first && a.second < b.second); });
        fprintf(out_, "\n%s:\n", title);
        for (size_t i = 0; i < n; i++) {
            std::string shown = v[i].second;
            for (char& c : shown)
                if (static_cast<unsigned char>(c) < 0x20 || c == 0x7f) c = '?';
            fprintf(out_, "  %10llu  %s\n", static_cast<unsigned long long>(v[i].first), shown.c_str());
        }
        if (others) fprintf(out_, "  %10llu  (others, not counted apart)\n", static_cast<unsigned long long>(others));
    }

    void write() {
        fprintf(out_, "Entries by source and priority:\n  %-7s", "source");
        for (int p = 0; p <= PRIO_VERBOSE; p++) fprintf(out_, " %8s", priority_name(p));
        fprintf(out_, " %8s %10s  %-26s  %s\n", "none", "total", "first", "last");
        for (int s = 0; s < SRC_COUNT; s++) {
            uint64_t total = 0;
            for (int p = 0; p < kPrioColumns; p++) total += counts_[s][p];
            if (total == 0) continue;
            fprintf(out_, "  %-7s", source_name(static_cast<Source>(s)));
            for (int p = 0; p < kPrioColumns; p++) fprintf(out_, " %8llu", static_cast<unsigned long long>(counts_[s][p]));
            const Span& span = spans_[s];
            fprintf(out_, " %10llu  %s  %s\n", static_cast<unsigned long long>(total),
                    when(span.first, span.any, span.offset).c_str(), when(span.last, span.any, span.offset).c_str());
        }
        fprintf(out_, "\nBoots:\n");
        for (const SectionCount& s : sections_) {
            std::string name = s.info.boot == 0 ? "run" : "held \"" + s.info.name + "\"";
            fprintf(out_, "  %3d %-18s %-28s %10llu entries  %s  %s%s\n", s.info.boot, name.c_str(), s.info.run.c_str(),
                    static_cast<unsigned long long>(s.entries), when(s.first, s.any, s.offset).c_str(),
                    when(s.last, s.any, s.offset).c_str(), s.info.kernel_timed ? "" : "  (kernel: time since boot)");
        }
        top("Busiest tags", tags_, other_tags_);
        top("Busiest pids", pids_, other_pids_);
        char title[64];
        snprintf(title, sizeof(title), "Gaps longer than %lld s", static_cast<long long>(gap_ns_ / 1000000000));
        list(title, gaps_);
        list("Overload markers (ORU trigger log)", overload_);
        for (const char* problem : {"app crash", "native crash", "ANR", "kernel oops or panic", "watchdog",
                                    "low memory kill", "reboot", "reboot between held boots"}) {
            auto it = findings_.find(problem);
            list(problem, it == findings_.end() ? FindingList() : it->second);
        }
        fflush(out_);
    }

    FILE* out_;
    int64_t gap_ns_;
    uint64_t counts_[SRC_COUNT][kPrioColumns] = {};
    Span spans_[SRC_COUNT];
    std::vector<SectionCount> sections_;
    std::unordered_map<std::string, uint64_t> tags_;
    std::unordered_map<int32_t, uint64_t> pids_;
    uint64_t other_tags_ = 0, other_pids_ = 0;
    FindingList gaps_, overload_;
    std::map<std::string, FindingList> findings_;
    int64_t last_ = INT64_MIN;
    TimeFormat time_;
};

}  // namespace

std::unique_ptr<Sink> make_summary(FILE* out, int64_t gap_s) { return std::unique_ptr<Sink>(new Summary(out, gap_s)); }

}  // namespace tavlolog
