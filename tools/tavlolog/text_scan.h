// Helpers of the outputs' hot path: numbers without printf, and a scan that
// passes plain ASCII sixteen (without SSE2 eight) bytes at a time.
#pragma once

#include <cstdint>
#include <cstring>

#if defined(__SSE2__)
#include <emmintrin.h>
#endif

namespace tavlolog {

// The first byte from p that is not printable ASCII (below 0x20, 0x7f or
// above), or, with json, also '"' or '\\'; end when there is none.
inline const unsigned char* plain_until(const unsigned char* p, const unsigned char* end, bool json) {
#if defined(__SSE2__)
    const __m128i low = _mm_set1_epi8(0x1f), del = _mm_set1_epi8(0x7f);
    const __m128i quote = _mm_set1_epi8('"'), backslash = _mm_set1_epi8('\\');
    while (end - p >= 16) {
        __m128i x = _mm_loadu_si128(reinterpret_cast<const __m128i*>(p));
        // Signed: the bytes from 0x80 are negative, so below 0x20 too.
        __m128i good = _mm_and_si128(_mm_cmpgt_epi8(x, low), _mm_cmplt_epi8(x, del));
        if (json)
            good = _mm_andnot_si128(_mm_or_si128(_mm_cmpeq_epi8(x, quote), _mm_cmpeq_epi8(x, backslash)), good);
        unsigned mask = static_cast<unsigned>(_mm_movemask_epi8(good));
        if (mask != 0xffff) return p + __builtin_ctz(~mask);
        p += 16;
    }
#else
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
#endif
    for (; p < end; p++) {
        unsigned char c = *p;
        if (c < 0x20 || c >= 0x7f || (json && (c == '"' || c == '\\'))) break;
    }
    return p;
}

// Copies the bytes from p that plain_until passes to w, advancing w: the
// first byte that needs care (or end). Writes up to 16 bytes beyond w's end.
inline const unsigned char* copy_plain(char*& w, const unsigned char* p, const unsigned char* end, bool json) {
#if defined(__SSE2__)
    const __m128i low = _mm_set1_epi8(0x1f), del = _mm_set1_epi8(0x7f);
    const __m128i quote = _mm_set1_epi8('"'), backslash = _mm_set1_epi8('\\');
    const unsigned char* start = p;
    while (end - p >= 16) {
        __m128i x = _mm_loadu_si128(reinterpret_cast<const __m128i*>(p));
        _mm_storeu_si128(reinterpret_cast<__m128i*>(w), x);
        __m128i good = _mm_and_si128(_mm_cmpgt_epi8(x, low), _mm_cmplt_epi8(x, del));
        if (json)
            good = _mm_andnot_si128(_mm_or_si128(_mm_cmpeq_epi8(x, quote), _mm_cmpeq_epi8(x, backslash)), good);
        unsigned mask = static_cast<unsigned>(_mm_movemask_epi8(good));
        if (mask != 0xffff) {
            int n = __builtin_ctz(~mask);
            w += n;
            return p + n;
        }
        p += 16;
        w += 16;
    }
    if (p == end) return p;
    size_t back = 0;
    __m128i x;
    if (p - start >= 16) {
        // The last 16 bytes, over some just copied as they are: copied again alike.
        back = static_cast<size_t>(16 - (end - p));
        x = _mm_loadu_si128(reinterpret_cast<const __m128i*>(end - 16));
    } else {
        // A short rest: through a block of its own, not byte by byte.
        unsigned char rest[16] = {};
        memcpy(rest, p, static_cast<size_t>(end - p));
        x = _mm_loadu_si128(reinterpret_cast<const __m128i*>(rest));
    }
    _mm_storeu_si128(reinterpret_cast<__m128i*>(w - back), x);
    __m128i good = _mm_and_si128(_mm_cmpgt_epi8(x, low), _mm_cmplt_epi8(x, del));
    if (json) good = _mm_andnot_si128(_mm_or_si128(_mm_cmpeq_epi8(x, quote), _mm_cmpeq_epi8(x, backslash)), good);
    // The bytes before p were passed already; the scan stops at end.
    size_t rest = static_cast<size_t>(end - p);
    unsigned mask = (static_cast<unsigned>(_mm_movemask_epi8(good)) | ((1u << back) - 1)) & ((1u << (back + rest)) - 1);
    size_t n = static_cast<size_t>(__builtin_ctz(~mask)) - back;
    w += n;
    return p + n;
#else
    const unsigned char* q = plain_until(p, end, json);
    memcpy(w, p, static_cast<size_t>(q - p));
    w += q - p;
    return q;
#endif
}

// Two decimal digits of v (below 100) at p.
inline void put_digits(char* p, uint32_t v) {
    static const char kPairs[] =
        "00010203040506070809101112131415161718192021222324252627282930313233343536373839"
        "40414243444546474849505152535455565758596061626364656667686970717273747576777879"
        "8081828384858687888990919293949596979899";
    memcpy(p, kPairs + 2 * v, 2);
}

// Writes v in decimal at p, right-aligned in width: the end.
inline char* put_number(char* p, int64_t v, int width = 0) {
    uint64_t u = v < 0 ? static_cast<uint64_t>(-(v + 1)) + 1 : static_cast<uint64_t>(v);
    int len = 1;
    for (uint64_t t = u; t >= 10; t /= 10) len++;
    len += v < 0;
    for (; len < width; width--) *p++ = ' ';
    char* end = p + len;
    char* q = end;
    while (u >= 100) {
        q -= 2;
        put_digits(q, static_cast<uint32_t>(u % 100));
        u /= 100;
    }
    if (u >= 10) {
        q -= 2;
        put_digits(q, static_cast<uint32_t>(u));
    } else {
        *--q = static_cast<char>('0' + u);
    }
    if (v < 0) *--q = '-';
    return end;
}

}  // namespace tavlolog
