// Byte-string, memory and UCS-2 string routines. They carry the standard
// names but live in namespace nimb, so that the host build never mixes them
// up with the C library's; where one behaves unlike the standard routine, its
// comment says so, because code elsewhere depends on the exact behaviour.
#pragma once

#include "efi/efi.h"

namespace nimb {

// Stores the low byte of `value` `count` times; returns `destination`.
void *memset(void *destination, int value, UINTN count);
// Gives what a byte loop upward gives, overlap included; returns
// `destination`.
void *memcpy(void *destination, const void *source, UINTN count);
// Byte loop downward where the destination overlaps the source from above,
// else upward: the copy is right for overlapping ranges.
void *memmove(void *destination, const void *source, UINTN count);
void bzero(void *destination, UINTN count);
// Source first (the reverse of memcpy), byte loop upward, no overlap handling.
void bcopy(const void *source, void *destination, UINTN count);
// Difference of the first two unequal bytes, read as signed; 0 when equal.
// Aligned buffers of a multiple of 8 bytes are compared a word at a time.
int memcmp(const void *a, const void *b, UINTN count);

UINT32 strlen(const char *text);
// Stops at the first difference or at the NUL of `a`; the difference of the
// two characters, read as signed.
int strcmp(const char *a, const char *b);
// `count` of 0 or below gives 0.
int strncmp(const char *a, const char *b, INT32 count);
char *strcpy(char *destination, const char *source);
// Copies up to and including the NUL, at most `count` bytes; the rest of the
// `count` bytes is left alone, and a source of `count` bytes or more leaves no
// NUL.
char *strncpy(char *destination, const char *source, UINTN count);
// Compares with bit 5 cleared in both characters (any character, not only
// letters), stopping with 0 at the NUL of `a`.
int strncasecmp(const char *a, const char *b, INT32 count);
// Blanks, tabs and newlines skipped; sign; 0x prefix for base 0 or 16; base 8
// for a leading 0 with base 0; saturates at 2^64 - 1 on overflow.
UINT64 strtoul(const char *text, char **end, INT32 base);

void StrCpy(CHAR16 *destination, const CHAR16 *source);
UINT64 StrLen(const CHAR16 *text);
INT64 StrCmp(const CHAR16 *a, const CHAR16 *b);
BOOLEAN CompareGuid(const EFI_GUID *a, const EFI_GUID *b);

}  // namespace nimb
