#include "tools/tavlolog/run_folder.h"

#include <dirent.h>
#include <fcntl.h>
#include <sys/stat.h>
#include <unistd.h>

#include <algorithm>
#include <cstring>
#include <map>

#include "tools/tavlolog/line_parse.h"
#include "tools/tavlolog/warnings.h"

namespace tavlolog {

const LogType kLogTypes[5] = {
    {"kernel_log", SRC_KERNEL}, {"main_log", SRC_MAIN}, {"radio_log", SRC_RADIO},
    {"events_log", SRC_EVENTS}, {"bt_log", SRC_BT},
};

namespace {

constexpr int kGenerations = 4;  // X.1 .. X.4 beside the current X

// Held suffixes of the run's own boot, and the order of the others (oldest first)
// where their logs hold no time to order them by.
constexpr const char* kSameBoot[] = {"boot", "kelm_boot"};
constexpr const char* kHeldOrder[] = {"prev_boot", "hbr", "otherboot", "kelm_boot", "boot"};

bool is_dir(const std::string& path) {
    struct stat st;
    return stat(path.c_str(), &st) == 0 && S_ISDIR(st.st_mode);
}

bool all_digits(const std::string& s) {
    return !s.empty() && s.size() < 6 && std::all_of(s.begin(), s.end(), [](char c) { return c >= '0' && c <= '9'; });
}

std::vector<std::string> list_dir(const std::string& path, bool* ok) {
    std::vector<std::string> names;
    DIR* dir = opendir(path.c_str());
    *ok = dir != nullptr;
    if (dir == nullptr) return names;
    while (struct dirent* e = readdir(dir)) {
        if (e->d_name[0] != '.') names.push_back(e->d_name);
    }
    closedir(dir);
    std::sort(names.begin(), names.end());
    return names;
}

// The time part of a run name, for ordering runs: "2026_0304_070649".
std::string time_part(const std::string& name) {
    size_t at = name.find('_');
    return at == std::string::npos ? name : name.substr(at + 1);
}

bool is_run_name(const std::string& name) {
    int y, m, d;
    return date_of_run_name(name, &y, &m, &d);
}

bool holds_logs(const std::string& path) {
    for (const LogType& type : kLogTypes) {
        struct stat st;
        if (stat((path + type.name).c_str(), &st) == 0) return true;
    }
    return false;
}

// The last "[debug.TQ.boot_wallclock]: [VALUE]" of the run's properties.
void read_boot_wallclock(RunFolder* run) {
    int fd = open((run->path + "properties").c_str(), O_RDONLY | O_CLOEXEC | O_NONBLOCK);
    if (fd < 0) return;
    struct stat st;
    if (fstat(fd, &st) != 0 || !S_ISREG(st.st_mode)) {
        close(fd);
        return;
    }
    const std::string key = std::string("[") + kBootWallclockProperty + "]: [";
    std::string window, value;
    char buf[65536];
    for (ssize_t n; (n = read(fd, buf, sizeof(buf))) > 0;) {
        window.append(buf, static_cast<size_t>(n));
        for (size_t at = 0; (at = window.find(key, at)) != std::string::npos; at += key.size()) {
            size_t end = window.find(']', at + key.size());
            if (end == std::string::npos) break;
            value = window.substr(at + key.size(), end - at - key.size());
        }
        // Keep a tail in which a key cut by the read can still be found whole.
        if (window.size() > 256) window.erase(0, window.size() - 256);
    }
    close(fd);
    int64_t ns;
    if (!value.empty() && parse_wallclock(value, &ns)) {
        run->has_boot_wallclock = true;
        run->boot_wallclock_ns = ns;
    } else if (!value.empty()) {
        warn("%sproperties: %s is \"%s\", not SECONDS.NANOS", run->path.c_str(), kBootWallclockProperty,
             value.c_str());
    }
}

void warn_missing_generations(const RunFolder& run, const char* type, const bool present[kGenerations + 1]) {
    // A generation missing below an older one that is there was lost.
    int oldest = -1;
    for (int g = kGenerations; g >= 0 && oldest < 0; g--)
        if (present[g]) oldest = g;
    for (int g = oldest - 1; g >= 0; g--) {
        if (present[g]) continue;
        if (g == 0)
            warn("%s%s is missing (its older generations are there)", run.path.c_str(), type);
        else
            warn("%s%s.%d is missing between its older and newer generations", run.path.c_str(), type, g);
    }
}

}  // namespace

bool date_of_run_name(const std::string& name, int* year, int* month, int* day) {
    const char* p = name.c_str();
    if (name.rfind("APLog_", 0) == 0) {
        p += 6;
    } else if (name.rfind("BOOTFAIL_", 0) == 0) {
        p += 9;
    } else {
        return false;
    }
    int y, m, d, hh, mm, ss, used = 0;
    if (sscanf(p, "%4d_%2d%2d_%2d%2d%2d%n", &y, &m, &d, &hh, &mm, &ss, &used) != 6 || used != 16) return false;
    if (m < 1 || m > 12 || d < 1 || d > 31) return false;
    *year = y;
    *month = m;
    *day = d;
    return true;
}

bool parse_wallclock(const std::string& text, int64_t* ns) {
    int64_t secs = 0, frac = 0;
    size_t i = 0;
    for (; i < text.size() && text[i] >= '0' && text[i] <= '9' && i < 12; i++) secs = secs * 10 + (text[i] - '0');
    if (i == 0) return false;
    int digits = 0;
    if (i < text.size() && text[i] == '.') {
        for (i++; i < text.size() && text[i] >= '0' && text[i] <= '9' && digits < 9; i++, digits++)
            frac = frac * 10 + (text[i] - '0');
    }
    if (i != text.size() || secs >= MAX_TIME_S) return false;
    for (; digits < 9; digits++) frac *= 10;
    *ns = secs * 1000000000 + frac;
    return true;
}

bool same_boot_suffix(const std::string& suffix) {
    for (const char* s : kSameBoot)
        if (suffix == s) return true;
    return false;
}

int held_rank(const std::string& suffix) {
    for (size_t i = 0; i < sizeof(kHeldOrder) / sizeof(kHeldOrder[0]); i++)
        if (suffix == kHeldOrder[i]) return static_cast<int>(i);
    return 2;  // an unknown boot: among the earlier boots
}

bool scan_run(const std::string& path, RunFolder* run) {
    *run = RunFolder();
    run->path = path.empty() || path.back() == '/' ? path : path + "/";
    std::string trimmed = run->path.substr(0, run->path.size() - 1);
    run->name = trimmed.substr(trimmed.rfind('/') == std::string::npos ? 0 : trimmed.rfind('/') + 1);
    bool ok;
    std::vector<std::string> names = list_dir(run->path, &ok);
    if (!ok) {
        warn("%s cannot be read: %s", run->path.c_str(), strerror(errno));
        return false;
    }
    int y, m, d;
    if (date_of_run_name(run->name, &y, &m, &d)) {
        run->has_date = true;
        run->folder_days = days_from_civil(y, m, d);
    } else {
        struct stat st;
        if (stat(run->path.c_str(), &st) == 0) {
            run->has_date = true;
            run->folder_days = st.st_mtime / 86400;
        }
        warn("%s: the folder's name does not tell its date; the years of its lines follow the folder's time",
             run->path.c_str());
    }
    read_boot_wallclock(run);

    SectionFiles current;
    std::map<std::string, SectionFiles> held;
    for (const LogType& type : kLogTypes) {
        const std::string base = type.name;
        bool present[kGenerations + 1] = {};
        std::vector<std::pair<int, std::string>> gens;  // number, name
        for (const std::string& name : names) {
            if (name.compare(0, base.size(), base) != 0) continue;
            if (name.size() == base.size()) {
                present[0] = true;
                gens.push_back({0, name});
                continue;
            }
            if (name[base.size()] != '.') continue;
            std::string suffix = name.substr(base.size() + 1);
            if (all_digits(suffix)) {
                // Pieces beyond .4 (swept over from a holding folder) are older still.
                int g = atoi(suffix.c_str());
                if (g <= kGenerations) present[g] = true;
                gens.push_back({g, name});
            } else {
                SectionFiles& s = held[suffix];
                s.name = suffix;
                s.same_boot = same_boot_suffix(suffix);
                s.lanes.push_back(LaneFiles{type.source, "", {Piece{run->path + name, name}}});
            }
        }
        std::sort(gens.begin(), gens.end(), [](auto& a, auto& b) { return a.first > b.first; });
        LaneFiles lane{type.source, run->path + base, {}};
        for (auto& g : gens) lane.pieces.push_back(Piece{run->path + g.second, g.second});
        warn_missing_generations(*run, type.name, present);
        current.lanes.push_back(lane);
    }
    for (auto& h : held) run->sections.push_back(h.second);
    current.boot = 0;
    current.same_boot = true;
    run->sections.push_back(current);
    return true;
}

std::vector<std::string> find_runs(const std::vector<std::string>& paths) {
    std::vector<std::string> runs;
    for (std::string path : paths) {
        if (path.empty()) continue;
        if (path.back() != '/') path += '/';
        if (!is_dir(path)) {
            warn("%s is not a folder", path.c_str());
            continue;
        }
        std::string trimmed = path.substr(0, path.size() - 1);
        std::string last = trimmed.substr(trimmed.rfind('/') == std::string::npos ? 0 : trimmed.rfind('/') + 1);
        if (is_run_name(last) || holds_logs(path)) {
            runs.push_back(path);
            continue;
        }
        // A folder of runs, or the log path above qrvlog/tavlolog/.
        for (const char* below : {"", "tavlolog/", "qrvlog/tavlolog/"}) {
            bool ok;
            std::vector<std::string> names = list_dir(path + below, &ok);
            std::vector<std::string> found;
            for (const std::string& name : names)
                if (is_run_name(name) && is_dir(path + below + name)) found.push_back(path + below + name + "/");
            std::stable_sort(found.begin(), found.end(), [](const std::string& a, const std::string& b) {
                auto part = [](const std::string& p) {
                    std::string t = p.substr(0, p.size() - 1);
                    return time_part(t.substr(t.rfind('/') + 1));
                };
                return part(a) < part(b);
            });
            if (!found.empty()) {
                runs.insert(runs.end(), found.begin(), found.end());
                break;
            }
        }
    }
    return runs;
}

}  // namespace tavlolog
