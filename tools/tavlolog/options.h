// tavlolog's command line, parsed into what the program does (the tests parse
// their scenarios' arguments the same way).
#pragma once

#include <string>
#include <vector>

#include "tools/tavlolog/filter.h"

namespace tavlolog {

extern const char kHelp[];

struct Options {
    Filter filter;
    bool json = false, summary = false, follow = false, pager = true;
    int colour = -1;  // auto
    long gap = 60;
    const char* html = nullptr;
    std::vector<std::string> paths;
};

// 0 parsed, 1 --help, 2 a usage error (described in *error).
int parse_options(int argc, char** argv, Options* options, std::string* error);

}  // namespace tavlolog
