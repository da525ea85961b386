// The machine state in which the kernel was entered, as the entry stub
// (entry.S) saved it before anything else ran. The stub writes the record at
// the offsets below; the C++ side checks them against the structure.
#pragma once

#define ENTRY_EAX 0
#define ENTRY_EBX 4
#define ENTRY_ECX 8
#define ENTRY_EDX 12
#define ENTRY_ESI 16
#define ENTRY_EDI 20
#define ENTRY_EBP 24
#define ENTRY_ESP 28
#define ENTRY_EFLAGS 32
#define ENTRY_CS 36
#define ENTRY_DS 40
#define ENTRY_ES 44
#define ENTRY_FS 48
#define ENTRY_GS 52
#define ENTRY_SS 56
#define ENTRY_CR0 60
#define ENTRY_CR3 64
#define ENTRY_CR4 68
#define ENTRY_EFER_LOW 72
#define ENTRY_EFER_HIGH 76
#define ENTRY_GDT_LIMIT 82
#define ENTRY_GDT_BASE 84
#define ENTRY_ENTRY_ADDRESS 88
#define ENTRY_IMAGE_START 92
#define ENTRY_IMAGE_END 96
#define ENTRY_TSC_LOW 100
#define ENTRY_TSC_HIGH 104
#define ENTRY_SIZE 108

#ifndef __ASSEMBLER__

#include <stddef.h>
#include <stdint.h>

namespace nimb::guest {

struct EntryState {
  uint32_t eax, ebx, ecx, edx, esi, edi, ebp, esp;
  uint32_t eflags;
  // Selectors, each stored as a 16-bit value with the upper half zero.
  uint32_t cs, ds, es, fs, gs, ss;
  uint32_t cr0, cr3, cr4;
  uint32_t eferLow, eferHigh;  // IA32_EFER, read right after the registers
  uint16_t gdtPad;             // SGDT writes limit and base from gdtLimit on
  uint16_t gdtLimit;
  uint32_t gdtBase;
  uint32_t entryAddress;  // where the stub starts: EDI should hold this
  uint32_t imageStart;    // the kernel's own image in memory
  uint32_t imageEnd;
  // The time stamp counter right after the general registers were saved:
  // the moment of entry, for timings that end in the kernel.
  uint32_t tscLow, tscHigh;
};

static_assert(offsetof(EntryState, edi) == ENTRY_EDI);
static_assert(offsetof(EntryState, eflags) == ENTRY_EFLAGS);
static_assert(offsetof(EntryState, ss) == ENTRY_SS);
static_assert(offsetof(EntryState, cr4) == ENTRY_CR4);
static_assert(offsetof(EntryState, eferHigh) == ENTRY_EFER_HIGH);
static_assert(offsetof(EntryState, gdtLimit) == ENTRY_GDT_LIMIT);
static_assert(offsetof(EntryState, gdtBase) == ENTRY_GDT_BASE);
static_assert(offsetof(EntryState, entryAddress) == ENTRY_ENTRY_ADDRESS);
static_assert(offsetof(EntryState, imageEnd) == ENTRY_IMAGE_END);
static_assert(offsetof(EntryState, tscHigh) == ENTRY_TSC_HIGH);
static_assert(sizeof(EntryState) == ENTRY_SIZE);

constexpr uint32_t kEntryEcx = 0xC0000080;  // IA32_EFER's number, left by the gate
constexpr uint32_t kCodeSelector = 0x08;
constexpr uint32_t kDataSelector = 0x10;
constexpr uint32_t kCr0Pe = 1u << 0;
constexpr uint32_t kCr0Pg = 1u << 31;
constexpr uint32_t kEflagsIf = 1u << 9;
constexpr uint32_t kEferLme = 1u << 8;
constexpr uint32_t kEferLma = 1u << 10;

}  // namespace nimb::guest

#endif
