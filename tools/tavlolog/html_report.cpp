// A plain stand-in for the HTML report: the entries' text as an escaped list.
#include "tools/tavlolog/html_report.h"

#include <unistd.h>

#include <cerrno>
#include <string>

namespace tavlolog {

struct HtmlReport::State {
    FILE* out = nullptr;
    std::string path;
    bool failed = false;
};

namespace {

void escaped(FILE* out, std::string_view s) {
    for (unsigned char c : s) {
        switch (c) {
            case '<': fputs("&lt;", out); break;
            case '>': fputs("&gt;", out); break;
            case '&': fputs("&amp;", out); break;
            case '"': fputs("&quot;", out); break;
            default:
                if (c < 0x20 && c != '\t') fprintf(out, "\\x%02x", c);
                else fputc(c, out);
        }
    }
}

}  // namespace

HtmlReport::~HtmlReport() {
    if (state_ != nullptr) close();
}

int HtmlReport::open(const char* path, const char* title) {
    FILE* out = fopen(path, "w");
    if (out == nullptr) return -1;
    state_ = new State{out, path, false};
    fputs("<!DOCTYPE html>\n<html><head><meta charset=\"utf-8\"><title>", out);
    escaped(out, title);
    fputs("</title></head><body><pre>\n", out);
    return 0;
}

void HtmlReport::add(const Entry& e) {
    if (state_ == nullptr) return;
    fputc(SOURCE_LETTER[e.source], state_->out);
    fputc(' ', state_->out);
    if (!e.tag.empty()) {
        escaped(state_->out, e.tag);
        fputs(": ", state_->out);
    }
    escaped(state_->out, e.message);
    fputc('\n', state_->out);
}

int HtmlReport::close() {
    if (state_ == nullptr) return -1;
    fputs("</pre></body></html>\n", state_->out);
    bool ok = !ferror(state_->out);
    ok = fclose(state_->out) == 0 && ok;
    if (!ok) unlink(state_->path.c_str());
    delete state_;
    state_ = nullptr;
    return ok ? 0 : -1;
}

}  // namespace tavlolog
