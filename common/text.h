// The sanitizers of outside text shown in one-line records and file headers.
// Each keeps the output its readers have always seen, so they differ on purpose.
#pragma once

#include <stddef.h>

// A history record's message, in place: a line feed that ends it is dropped;
// other control bytes (tab excepted) and DEL become '?'; other bytes stay.
void printable_record(char* s);

// A header line's value of len bytes, in place: every control byte (tab
// included) and DEL become '?'; bytes above 0x7f stay.
void printable_header(char* s, size_t len);

// Copies src into dst (size n) with control and non-ASCII bytes shown as '?',
// so that outside input never breaks a one-line record.
void printable_copy(char* dst, int n, const char* src);
