#include "tools/tavlolog/filter.h"

#include <strings.h>

#include <algorithm>
#include <cctype>
#include <cstdlib>
#include <cstring>

#include "tools/tavlolog/line_parse.h"

namespace tavlolog {

namespace {

constexpr int64_t kSecond = 1000000000;

bool parse_number(const char*& p, int digits, int* out) {
    int v = 0;
    for (int i = 0; i < digits; i++, p++) {
        if (!isdigit(static_cast<unsigned char>(*p))) return false;
        v = v * 10 + (*p - '0');
    }
    *out = v;
    return true;
}

bool parse_relative(const char* text, int64_t* ns) {
    const char* p = text;
    int sign = *p == '-' ? -1 : 1;
    if (*p == '-' || *p == '+') p++;
    char* end;
    double value = strtod(p, &end);
    if (end == p || value < 0) return false;
    static const struct {
        const char* unit;
        int64_t ns;
    } units[] = {{"us", 1000}, {"ms", 1000000}, {"s", kSecond}, {"sec", kSecond}, {"min", 60 * kSecond},
                 {"m", 60 * kSecond}, {"h", 3600 * kSecond}, {"hour", 3600 * kSecond},
                 {"d", 86400 * kSecond}, {"day", 86400 * kSecond}, {"", kSecond}};
    for (const auto& u : units) {
        if (strcmp(end, u.unit) == 0) {
            *ns = sign * static_cast<int64_t>(value * static_cast<double>(u.ns));
            return true;
        }
    }
    return false;
}

int priority_word(const char* text) {
    static const struct {
        const char* word;
        int priority;
    } words[] = {{"emerg", 0}, {"alert", 1}, {"crit", 2}, {"err", 3}, {"error", 3}, {"warning", 4}, {"warn", 4},
                 {"notice", 5}, {"info", 6}, {"debug", 7}, {"verbose", 8}, {"f", 2}, {"e", 3}, {"w", 4},
                 {"i", 6}, {"d", 7}, {"v", 8}, {"fatal", 2}};
    if (text[0] >= '0' && text[0] <= '8' && text[1] == '\0') return text[0] - '0';
    for (const auto& w : words)
        if (strcasecmp(text, w.word) == 0) return w.priority;
    return -1;
}

}  // namespace

bool parse_time_arg(const char* text, TimeArg* out) {
    if (text[0] == '-' || text[0] == '+') {
        out->kind = TimeArg::RELATIVE;
        return parse_relative(text, &out->ns);
    }
    if (text[0] == '@') {
        char* end;
        double secs = strtod(text + 1, &end);
        if (end == text + 1 || *end != '\0') return false;
        out->kind = TimeArg::INSTANT;
        out->ns = static_cast<int64_t>(secs * static_cast<double>(kSecond));
        return true;
    }
    const char* p = text;
    int y, mo, d, h = 0, mi = 0, s = 0;
    if (!parse_number(p, 4, &y) || *p++ != '-' || !parse_number(p, 2, &mo) || *p++ != '-' ||
        !parse_number(p, 2, &d))
        return false;
    if (mo < 1 || mo > 12 || d < 1 || d > 31) return false;
    int64_t frac = 0;
    if (*p == ' ' || *p == 'T') {
        p++;
        if (!parse_number(p, 2, &h) || *p++ != ':' || !parse_number(p, 2, &mi)) return false;
        if (*p == ':') {
            p++;
            if (!parse_number(p, 2, &s)) return false;
            if (*p == '.') {
                int n = 0;
                for (p++; isdigit(static_cast<unsigned char>(*p)); p++, n++)
                    if (n < 9) frac = frac * 10 + (*p - '0');
                for (; n < 9; n++) frac *= 10;
            }
        }
    }
    int64_t local = (days_from_civil(y, mo, d) * 86400 + h * 3600 + mi * 60 + s) * kSecond + frac;
    if (*p == '\0') {
        out->kind = TimeArg::LOCAL;
        out->ns = local;
        return true;
    }
    int64_t offset = 0;
    if (*p == 'Z' && p[1] == '\0') {
        offset = 0;
    } else if ((*p == '+' || *p == '-') && strlen(p) == 6 && p[3] == ':') {
        int oh, om;
        const char* q = p + 1;
        if (!parse_number(q, 2, &oh) || *q++ != ':' || !parse_number(q, 2, &om)) return false;
        offset = (*p == '-' ? -1 : 1) * (oh * 3600 + om * 60);
    } else {
        return false;
    }
    out->kind = TimeArg::INSTANT;
    out->ns = local - offset * kSecond;
    return true;
}

bool parse_priority(const char* text, int* most_severe, int* least_severe) {
    std::string s(text);
    size_t range = s.find("..");
    int a, b;
    if (range == std::string::npos) {
        a = 0;
        b = priority_word(s.c_str());
    } else {
        a = range == 0 ? 0 : priority_word(s.substr(0, range).c_str());
        b = range + 2 == s.size() ? PRIO_VERBOSE : priority_word(s.substr(range + 2).c_str());
    }
    if (a < 0 || b < 0) return false;
    *most_severe = std::min(a, b);
    *least_severe = std::max(a, b);
    return true;
}

bool parse_sources(const char* text, unsigned* mask) {
    static const char* const names[SRC_COUNT] = {"kernel", "main", "system", "radio", "events", "bt"};
    unsigned m = 0;
    std::string s(text);
    for (size_t at = 0; at <= s.size();) {
        size_t comma = s.find(',', at);
        std::string word = s.substr(at, comma == std::string::npos ? std::string::npos : comma - at);
        at = comma == std::string::npos ? s.size() + 1 : comma + 1;
        bool named = false;
        for (int i = 0; i < SRC_COUNT; i++) {
            if (strcasecmp(word.c_str(), names[i]) == 0) {
                m |= 1u << i;
                named = true;
            }
        }
        if (named) continue;
        if (word.empty()) return false;
        for (char c : word) {
            const char* at_letter = strchr(SOURCE_LETTER, toupper(static_cast<unsigned char>(c)));
            if (at_letter == nullptr || c == '\0') return false;
            m |= 1u << (at_letter - SOURCE_LETTER);
        }
    }
    *mask = m;
    return m != 0;
}

Filter::~Filter() {
    if (has_grep_) regfree(&grep_);
}

bool Filter::set_grep(const char* pattern, std::string* error) {
    bool capitals = std::any_of(pattern, pattern + strlen(pattern), [](char c) { return isupper(static_cast<unsigned char>(c)); });
    int rc = regcomp(&grep_, pattern, REG_EXTENDED | REG_NOSUB | (capitals ? 0 : REG_ICASE));
    if (rc != 0) {
        char text[256];
        regerror(rc, &grep_, text, sizeof(text));
        *error = text;
        return false;
    }
    has_grep_ = true;
    return true;
}

void Filter::resolve(int64_t end_ns) {
    for (TimeArg* t : {&since, &until}) {
        if (t->kind != TimeArg::RELATIVE) continue;
        t->kind = TimeArg::INSTANT;
        t->ns += end_ns;
    }
}

bool Filter::boot_wanted(int boot_number, const std::string& name) const {
    if (!has_boot) return true;
    if (boot_name.empty()) return boot == boot_number;
    return boot_name == (name.empty() ? "run" : name);
}

bool Filter::match(const Entry& e) const {
    if (!(sources & (1u << e.source))) return false;
    if (since.kind != TimeArg::NONE || until.kind != TimeArg::NONE) {
        // Entries without an instant cannot be placed in the span.
        if (!e.has_instant) return false;
        int64_t local = e.instant_ns + int64_t{e.utc_offset_s} * kSecond;
        if (since.kind != TimeArg::NONE && (since.kind == TimeArg::LOCAL ? local : e.instant_ns) < since.ns)
            return false;
        if (until.kind != TimeArg::NONE && (until.kind == TimeArg::LOCAL ? local : e.instant_ns) > until.ns)
            return false;
    }
    if (has_priority && (e.priority == PRIO_NONE || e.priority < prio_min || e.priority > prio_max)) return false;
    if (!tags.empty() && std::find(tags.begin(), tags.end(), e.tag) == tags.end()) return false;
    if (!pids.empty() && std::find(pids.begin(), pids.end(), e.pid) == pids.end()) return false;
    if (has_grep_) {
        scratch_.assign(e.message.data(), e.message.size());
        if (regexec(&grep_, scratch_.c_str(), 0, nullptr, 0) != 0) return false;
    }
    return true;
}

}  // namespace tavlolog
