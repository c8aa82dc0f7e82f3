// Warnings about the folder being read (an unknown zone, a missing generation,
// an unreadable file): each text once, on standard error, so that the merged
// stream on standard output stays clean.
#pragma once

#include <string>
#include <vector>

namespace tavlolog {

__attribute__((format(printf, 1, 2))) void warn(const char* format, ...);
// Every warning given so far, in order (the tests read them).
const std::vector<std::string>& warnings_given();
void set_warnings_quiet(bool quiet);

}  // namespace tavlolog
