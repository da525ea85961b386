// The call gate: leaves 64-bit long mode for 32-bit protected mode without
// paging and jumps to its target. Called with the firmware's convention:
// RCX = value for EAX at the target, RDX = target address. It is copied to a
// page below 4 GiB before use, so everything in it is addressed relative to
// the instruction pointer and the copy needs no relocation. The two address
// fields are zero in the image and filled in each time the gate runs.
//
// Layout: 0x00 64-bit code, 0x37 landing code (32-bit), 0x5A far pointer,
// 0x60 GDT pseudo-descriptor, 0x6A three descriptors, 0x82 end.

        .data
        .globl  CallGateStart
        .globl  CallGateEnd

CallGateStart:
        .code64
        leaq    CallGateLanding(%rip), %rax
        movl    %eax, CallGateFarOffset(%rip)
        leaq    CallGateTable(%rip), %rax
        movq    %rax, CallGateTableBase(%rip)
        lgdt    CallGateTableLimit(%rip)
        movq    $0x10, %rax
        movl    %eax, %ds
        movl    %eax, %es
        movl    %eax, %gs
        movl    %eax, %fs
        ljmpl   *CallGateFarOffset(%rip)

CallGateLanding:
        .code32
        movl    %cr0, %eax
        andl    $0x7FFFFFFF, %eax           // paging off
        movl    %eax, %cr0
        movl    %ecx, %ebx
        movl    %edx, %edi
        movl    $0xC0000080, %ecx           // IA32_EFER
        rdmsr
        andl    $0xFFFFFEFF, %eax           // long mode off
        wrmsr
        jmp     1f
1:      movl    %ebx, %eax
        jmp     *%edi

CallGateFarOffset:
        .long   0
        .word   0x0008
CallGateTableLimit:
        .word   0x0018
CallGateTableBase:
        .quad   0
CallGateTable:
        .quad   0x0000000000000000
        .byte   0xFF, 0xFF, 0x00, 0x00, 0x00, 0x9E, 0xCF, 0x00
        .byte   0xFF, 0xFF, 0x00, 0x00, 0x00, 0x92, 0xCF, 0x00
CallGateEnd:
        .code64
