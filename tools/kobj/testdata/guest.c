// A tiny 32-bit kernel for the kobj tests: code, read-only data,
// initialised data and zero-initialised data, linked above 3 GiB so that
// the loader's placement at the low 30 bits of each address shows.
unsigned char guest_stack[4096];
unsigned int counter = 0x12345678;
const char message[] = "kernel object";
unsigned char scratch[6000];

__asm__(
    ".globl guest_start\n"
    "guest_start:\n"
    "  movl $(guest_stack + 4096), %esp\n"
    "  call guest_main\n"
    "1: hlt\n"
    "  jmp 1b\n");

void guest_main(void) {
  for (unsigned int i = 0; i < sizeof(message); i++)
    scratch[i * 300] = (unsigned char)(message[i] + counter);
  counter++;
}
