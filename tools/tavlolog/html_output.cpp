#include "tools/tavlolog/html_report.h"
#include "tools/tavlolog/output.h"

namespace tavlolog {

namespace {

class HtmlOutput : public Sink {
  public:
    explicit HtmlOutput(bool* ok) : ok_(ok) {}
    ~HtmlOutput() override { *ok_ = report_.close() == 0; }
    int open(const char* path, const char* title) { return report_.open(path, title); }
    void entry(const Entry& e) override { report_.add(e); }

  private:
    HtmlReport report_;
    bool* ok_;
};

}  // namespace

std::unique_ptr<Sink> make_html_output(const char* path, const char* title, bool* ok) {
    std::unique_ptr<HtmlOutput> sink(new HtmlOutput(ok));
    if (sink->open(path, title) != 0) return nullptr;
    return sink;
}

}  // namespace tavlolog
