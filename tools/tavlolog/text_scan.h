// Helpers of the outputs' hot path: numbers without printf, and a scan that
// passes plain ASCII eight bytes at a time.
#pragma once

#include <cstdint>
#include <cstring>
#include <string>

namespace tavlolog {

// The first byte from p that is not printable ASCII (below 0x20, 0x7f or
// above), or, with json, also '"' or '\\'; end when there is none.
inline const unsigned char* plain_until(const unsigned char* p, const unsigned char* end, bool json) {
    constexpr uint64_t ones = 0x0101010101010101ULL, highs = 0x8080808080808080ULL;
    while (end - p >= 8) {
        uint64_t x;
        memcpy(&x, p, 8);
        uint64_t bad = (x - ones * 0x20) | x | (x + ones * 0x01);  // below 0x20, high bit, 0x7f
        if (json) {
            uint64_t q = x ^ (ones * '"'), b = x ^ (ones * '\\');
            bad |= (q - ones) & ~q;
            bad |= (b - ones) & ~b;
        }
        if (bad & highs) break;
        p += 8;
    }
    for (; p < end; p++) {
        unsigned char c = *p;
        if (c < 0x20 || c >= 0x7f || (json && (c == '"' || c == '\\'))) break;
    }
    return p;
}

// Appends v in decimal, right-aligned in width.
inline void append_number(std::string& out, int64_t v, int width = 0) {
    char text[24];
    char* end = text + sizeof(text);
    char* p = end;
    uint64_t u = v < 0 ? static_cast<uint64_t>(-(v + 1)) + 1 : static_cast<uint64_t>(v);
    do {
        *--p = static_cast<char>('0' + u % 10);
        u /= 10;
    } while (u != 0);
    if (v < 0) *--p = '-';
    int len = static_cast<int>(end - p);
    if (len < width) out.append(static_cast<size_t>(width - len), ' ');
    out.append(p, static_cast<size_t>(len));
}

}  // namespace tavlolog
