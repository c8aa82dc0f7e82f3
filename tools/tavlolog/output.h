// The outputs of a merged timeline: text for the terminal, JSON Lines, the
// summary, and the HTML report; each is a Sink that writes as entries come.
#pragma once

#include <cstdio>
#include <memory>
#include <string>

#include "tools/tavlolog/timeline.h"

namespace tavlolog {

// Buffered writing to a stream; the outputs format into it by hand, which
// keeps a merge of a large folder bound by the disk, not by printf. Each
// entry asks for room for its longest form, writes through a pointer and
// commits; the stream gets one write per kSize bytes.
class OutBuffer {
  public:
    explicit OutBuffer(FILE* out) : out_(out), room_(kSize + kSlack), buf_(new char[room_]) {}
    ~OutBuffer() { flush(); }
    // A pointer with room for n bytes, valid until commit.
    char* reserve(size_t n) {
        if (room_ - len_ < n) make_room(n);
        return buf_.get() + len_;
    }
    void commit(char* end) {
        len_ = static_cast<size_t>(end - buf_.get());
        if (len_ >= kSize) flush();
    }
    void append(const std::string& s);
    void flush();
    bool failed() const { return failed_; }

  private:
    static constexpr size_t kSize = 256 * 1024;
    static constexpr size_t kSlack = 64 * 1024;  // an entry that starts just before kSize
    void make_room(size_t n);
    FILE* out_;
    size_t room_, len_ = 0;
    std::unique_ptr<char[]> buf_;
    bool failed_ = false;
};

// "2026-03-04 07:06:49.123000" in the entry's own zone, cached per second.
class TimeFormat {
  public:
    // 20 + fraction_digits characters: date, time, fraction (separator ' ' or 'T').
    void local(std::string& out, int64_t instant_ns, int32_t offset_s, char separator, int fraction_digits);
    char* local(char* out, int64_t instant_ns, int32_t offset_s, char separator, int fraction_digits);

  private:
    int64_t cached_s_ = INT64_MIN;
    char cached_sep_ = 0;
    char text_[24] = {};
};

// The name of a source in JSON and the summary ("kernel", "main", ...).
const char* source_name(Source s);
const char* kind_name(Kind k);

std::unique_ptr<Sink> make_text_output(FILE* out, bool colour);
std::unique_ptr<Sink> make_json_output(FILE* out);
// The summary is written when the sink is destroyed; gaps longer than gap_s count.
std::unique_ptr<Sink> make_summary(FILE* out, int64_t gap_s);
// The HTML report's sink; nullptr (errno set) when the file cannot be opened.
// Destroying the sink writes the page; *ok then tells whether that worked.
std::unique_ptr<Sink> make_html_output(const char* path, const char* title, bool* ok);

}  // namespace tavlolog
