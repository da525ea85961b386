#include "hold.h"

#include "text.h"

namespace nimb::guest {

namespace {

constexpr char kHoldKey[] = "guest.hold=";

bool IsBlank(char c) {
  return c == ' ' || c == '\t' || c == '\r' || c == '\n';
}

}  // namespace

uint32_t HoldSeconds(const char *commandLine, uint32_t length) {
  const uint32_t end = TextLength(commandLine, length);
  constexpr uint32_t keyLength = sizeof(kHoldKey) - 1;
  uint32_t i = 0;
  while (i < end) {
    while (i < end && IsBlank(commandLine[i])) {
      i++;
    }
    uint32_t wordEnd = i;
    while (wordEnd < end && !IsBlank(commandLine[wordEnd])) {
      wordEnd++;
    }
    bool keyFits = wordEnd - i >= keyLength;
    for (uint32_t k = 0; keyFits && k < keyLength; k++) {
      keyFits = commandLine[i + k] == kHoldKey[k];
    }
    if (keyFits) {
      uint32_t seconds = 0;
      uint32_t j = i + keyLength;
      if (j == wordEnd) {
        return 0;
      }
      for (; j < wordEnd; j++) {
        char c = commandLine[j];
        if (c < '0' || c > '9') {
          return 0;
        }
        seconds = seconds * 10 + static_cast<uint32_t>(c - '0');
        if (seconds > kMaxHoldSeconds) {
          seconds = kMaxHoldSeconds;
        }
      }
      return seconds;
    }
    i = wordEnd;
  }
  return 0;
}

}  // namespace nimb::guest
