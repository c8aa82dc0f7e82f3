// The self-contained HTML report of a merged timeline: entries are added in
// time order as they are merged, the page is written when the report closes.
#pragma once

#include <cstdio>

#include "tools/tavlolog/entry.h"

namespace tavlolog {

class HtmlReport {
  public:
    HtmlReport() = default;
    ~HtmlReport();
    HtmlReport(const HtmlReport&) = delete;
    HtmlReport& operator=(const HtmlReport&) = delete;

    // Opens FILE for writing; `title` names the run(s) in the page. 0 on
    // success, -1 with errno set.
    int open(const char* path, const char* title);
    void add(const Entry& entry);
    // Writes the rest of the page and closes the file. 0 on success, -1 when
    // anything could not be written (the file is then removed).
    int close();

  private:
    struct State;
    State* state_ = nullptr;
};

}  // namespace tavlolog
