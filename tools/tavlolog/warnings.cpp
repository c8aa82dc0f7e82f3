#include "tools/tavlolog/warnings.h"

#include <cstdarg>
#include <cstdio>
#include <set>

namespace tavlolog {

namespace {
std::vector<std::string> g_given;
std::set<std::string> g_seen;
bool g_quiet = false;
}  // namespace

void warn(const char* format, ...) {
    char text[1024];
    va_list args;
    va_start(args, format);
    vsnprintf(text, sizeof(text), format, args);
    va_end(args);
    if (!g_seen.insert(text).second) return;
    g_given.push_back(text);
    if (!g_quiet) fprintf(stderr, "tavlolog: %s\n", text);
}

const std::vector<std::string>& warnings_given() { return g_given; }
void set_warnings_quiet(bool quiet) { g_quiet = quiet; }

}  // namespace tavlolog
