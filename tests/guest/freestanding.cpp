// What the guest programs (the reference kernel and the restart probe) need
// of a runtime: their view of memory and the routines that the compiler
// calls on its own.
#include <stddef.h>
#include <stdint.h>

#include "memory.h"

namespace nimb::guest {

// Paging is off: an address is the memory itself.
const uint8_t *GuestMemory(uint32_t address, uint32_t length) {
  if (address == 0 || length > 0xFFFFFFFFu - address + 1) {
    return nullptr;
  }
  return reinterpret_cast<const uint8_t *>(static_cast<uintptr_t>(address));
}

}  // namespace nimb::guest

// The compiler may call these for copies and clears of aggregates; written
// with string instructions so that they can't turn into calls to themselves.
extern "C" void *memcpy(void *destination, const void *source, size_t count) {
  void *result = destination;
  __asm__ volatile("rep movsb" : "+D"(destination), "+S"(source), "+c"(count) : : "memory");
  return result;
}

extern "C" void *memset(void *destination, int value, size_t count) {
  void *result = destination;
  __asm__ volatile("rep stosb" : "+D"(destination), "+c"(count) : "a"(value) : "memory");
  return result;
}
