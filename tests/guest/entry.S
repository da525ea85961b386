// The kernel's first instructions. The loader's call gate arrives here in
// 32-bit protected mode without paging, on the firmware's stack and with the
// firmware's stack segment. The registers are saved before anything touches
// them; then the kernel takes its own stack and calls KernelMain with the
// saved record. Saving uses only moves, which leave EFLAGS as it came.
#include "entry.h"

#define KERNEL_DATA_SELECTOR 0x10
#define IA32_EFER 0xC0000080
#define STACK_SIZE 16384

  .code32
  .section .text.entry, "ax", @progbits
  .globl KernelEntry
  .type KernelEntry, @function
KernelEntry:
  movl %eax, gEntryState + ENTRY_EAX
  movl %ebx, gEntryState + ENTRY_EBX
  movl %ecx, gEntryState + ENTRY_ECX
  movl %edx, gEntryState + ENTRY_EDX
  movl %esi, gEntryState + ENTRY_ESI
  movl %edi, gEntryState + ENTRY_EDI
  movl %ebp, gEntryState + ENTRY_EBP
  movl %esp, gEntryState + ENTRY_ESP
  rdtsc
  movl %eax, gEntryState + ENTRY_TSC_LOW
  movl %edx, gEntryState + ENTRY_TSC_HIGH
  movw %cs, gEntryState + ENTRY_CS
  movw %ds, gEntryState + ENTRY_DS
  movw %es, gEntryState + ENTRY_ES
  movw %fs, gEntryState + ENTRY_FS
  movw %gs, gEntryState + ENTRY_GS
  movw %ss, gEntryState + ENTRY_SS
  movl %cr0, %eax
  movl %eax, gEntryState + ENTRY_CR0
  movl %cr3, %eax
  movl %eax, gEntryState + ENTRY_CR3
  movl %cr4, %eax
  movl %eax, gEntryState + ENTRY_CR4
  movl $IA32_EFER, %ecx
  rdmsr
  movl %eax, gEntryState + ENTRY_EFER_LOW
  movl %edx, gEntryState + ENTRY_EFER_HIGH
  sgdt gEntryState + ENTRY_GDT_LIMIT
  movl $KernelEntry, gEntryState + ENTRY_ENTRY_ADDRESS
  movl $__image_start, gEntryState + ENTRY_IMAGE_START
  movl $__image_end, gEntryState + ENTRY_IMAGE_END

  // Our own stack, in a segment we know.
  movw $KERNEL_DATA_SELECTOR, %ax
  movw %ax, %ss
  movl $gKernelStackTop, %esp
  pushfl
  popl gEntryState + ENTRY_EFLAGS
  cld

  pushl $gEntryState
  call KernelMain
  // KernelMain powers the machine off; should that fail, stop here.
1:
  cli
  hlt
  jmp 1b
  .size KernelEntry, . - KernelEntry

  // The record lives in initialised data, so that the data segment always
  // has bytes in the file: the loader skips a segment that has none.
  .section .data, "aw", @progbits
  .balign 4
gEntryState:
  .fill ENTRY_SIZE, 1, 0
  .size gEntryState, ENTRY_SIZE

  .section .bss, "aw", @nobits
  .balign 16
gKernelStack:
  .skip STACK_SIZE
gKernelStackTop:
