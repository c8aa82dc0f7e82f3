#include "common/text.h"

#include <string.h>

void printable_record(char* s) {
    // A message that ends its line itself keeps its text whole.
    size_t len = strlen(s);
    if (len > 0 && s[len - 1] == '\n') s[len - 1] = '\0';
    for (; *s != '\0'; s++) {
        unsigned char c = static_cast<unsigned char>(*s);
        if ((c < 0x20 && c != '\t') || c == 0x7f) *s = '?';
    }
}

void printable_header(char* s, size_t len) {
    for (size_t i = 0; i < len; i++) {
        unsigned char c = static_cast<unsigned char>(s[i]);
        if (c < 0x20 || c == 0x7f) s[i] = '?';
    }
}

void printable_copy(char* dst, int n, const char* src) {
    int i = 0;
    for (; i < n - 1 && src[i] != '\0'; i++) {
        unsigned char c = static_cast<unsigned char>(src[i]);
        dst[i] = (c < 0x20 || c >= 0x7f) ? '?' : static_cast<char>(c);
    }
    dst[i] = '\0';
}
