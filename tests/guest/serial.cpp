#include "serial.h"

#include "hold.h"
#include "report.h"

namespace nimb::guest {

namespace {

constexpr uint16_t kCom1 = 0x3F8;
constexpr uint16_t kData = kCom1 + 0;             // transmit; divisor low with DLAB
constexpr uint16_t kInterruptEnable = kCom1 + 1;  // divisor high with DLAB
constexpr uint16_t kFifoControl = kCom1 + 2;
constexpr uint16_t kLineControl = kCom1 + 3;
constexpr uint16_t kModemControl = kCom1 + 4;
constexpr uint16_t kLineStatus = kCom1 + 5;
constexpr uint8_t kLineDivisorLatch = 0x80;
constexpr uint8_t kLine8N1 = 0x03;
constexpr uint8_t kTransmitEmpty = 0x20;
// A port without a UART reads as 0xFF and passes at once; the bound only
// keeps a stuck UART from hanging the kernel.
constexpr uint32_t kTransmitPolls = 1000000;

constexpr uint16_t kDebugExitPort = 0xF4;

// The PIT's channel 2, gated and read through the system control port.
constexpr uint16_t kPitChannel2 = 0x42;
constexpr uint16_t kPitCommand = 0x43;
constexpr uint16_t kSystemControl = 0x61;
constexpr uint8_t kChannel2Gate = 0x01;
constexpr uint8_t kSpeakerData = 0x02;
constexpr uint8_t kChannel2Out = 0x20;
// Channel 2, low then high byte of the count, mode 0 (its output rises at
// the end of the count), binary.
constexpr uint8_t kChannel2OneShot = 0xB0;
// The PIT counts at 1.193182 MHz: 59659 counts are 50 ms.
constexpr uint16_t kCountsPerStep = 59659;
constexpr uint32_t kStepsPerSecond = 20;
// A machine whose port 0x61 never shows the output rising still gets on:
// each step ends after this many polls.
constexpr uint32_t kPollsPerStep = 2000000;

inline void PortWrite(uint16_t port, uint8_t value) {
  __asm__ volatile("outb %0, %1" : : "a"(value), "Nd"(port));
}

inline uint8_t PortRead(uint16_t port) {
  uint8_t value;
  __asm__ volatile("inb %1, %0" : "=a"(value) : "Nd"(port));
  return value;
}

void SerialWrite(uint8_t byte) {
  for (uint32_t i = 0; i < kTransmitPolls; i++) {
    if ((PortRead(kLineStatus) & kTransmitEmpty) != 0) {
      break;
    }
  }
  PortWrite(kData, byte);
}

}  // namespace

void SerialInit() {
  PortWrite(kInterruptEnable, 0);
  PortWrite(kLineControl, kLineDivisorLatch);
  PortWrite(kData, 1);  // 115200 baud
  PortWrite(kInterruptEnable, 0);
  PortWrite(kLineControl, kLine8N1);
  PortWrite(kFifoControl, 0x07);   // FIFOs on and cleared
  PortWrite(kModemControl, 0x03);  // DTR and RTS
}

void ReportOutput(char character) {
  if (character == '\n') {
    SerialWrite('\r');
  }
  SerialWrite(static_cast<uint8_t>(character));
}

void Hold(uint32_t seconds) {
  const uint8_t control = PortRead(kSystemControl);
  PortWrite(kSystemControl, static_cast<uint8_t>((control & ~kSpeakerData) | kChannel2Gate));
  for (uint32_t step = 0; step < seconds * kStepsPerSecond; step++) {
    PortWrite(kPitCommand, kChannel2OneShot);
    PortWrite(kPitChannel2, static_cast<uint8_t>(kCountsPerStep & 0xFF));
    PortWrite(kPitChannel2, static_cast<uint8_t>(kCountsPerStep >> 8));
    for (uint32_t poll = 0; poll < kPollsPerStep; poll++) {
      if ((PortRead(kSystemControl) & kChannel2Out) != 0) {
        break;
      }
    }
  }
  PortWrite(kSystemControl, control);
}

void PowerOff(uint8_t code) {
  PortWrite(kDebugExitPort, code);
  for (;;) {
    __asm__ volatile("cli; hlt");
  }
}

}  // namespace nimb::guest
