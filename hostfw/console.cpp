// The text console (ConOut and StdErr) and the console control protocol that
// switches the screen between text and graphics.
#include "hostfw/internal.h"

namespace hostfw {

namespace {

constexpr UINTN kColumns = 80;
constexpr UINTN kRows = 25;

TextOutput *FindOutput(State &s, EFI_SIMPLE_TEXT_OUTPUT_PROTOCOL *This) {
  if (This == &s.conOut.protocol)
    return &s.conOut;
  if (This == &s.stdErr.protocol)
    return &s.stdErr;
  return nullptr;
}

EFI_STATUS EFIAPI TextReset(EFI_SIMPLE_TEXT_OUTPUT_PROTOCOL *This, BOOLEAN) {
  State &s = Services::Active();
  EFI_STATUS failure;
  if (Refused(s, "TextReset", &failure))
    return failure;
  TextOutput *output = FindOutput(s, This);
  if (output == nullptr)
    return EFI_INVALID_PARAMETER;
  output->mode.CursorColumn = 0;
  output->mode.CursorRow = 0;
  return EFI_SUCCESS;
}

EFI_STATUS EFIAPI OutputString(EFI_SIMPLE_TEXT_OUTPUT_PROTOCOL *This, const CHAR16 *String) {
  State &s = Services::Active();
  EFI_STATUS failure;
  if (Refused(s, "OutputString", &failure))
    return failure;
  TextOutput *output = FindOutput(s, This);
  if (output == nullptr || String == nullptr)
    return EFI_INVALID_PARAMETER;
  output->calls.emplace_back(String);
  return EFI_SUCCESS;
}

EFI_STATUS EFIAPI TestString(EFI_SIMPLE_TEXT_OUTPUT_PROTOCOL *This, const CHAR16 *String) {
  State &s = Services::Active();
  EFI_STATUS failure;
  if (Refused(s, "TestString", &failure))
    return failure;
  return FindOutput(s, This) != nullptr && String != nullptr ? EFI_SUCCESS : EFI_INVALID_PARAMETER;
}

EFI_STATUS EFIAPI QueryMode(EFI_SIMPLE_TEXT_OUTPUT_PROTOCOL *This, UINTN ModeNumber, UINTN *Columns,
                            UINTN *Rows) {
  State &s = Services::Active();
  EFI_STATUS failure;
  if (Refused(s, "QueryMode", &failure))
    return failure;
  if (FindOutput(s, This) == nullptr || Columns == nullptr || Rows == nullptr)
    return EFI_INVALID_PARAMETER;
  if (ModeNumber != 0)
    return EFI_UNSUPPORTED;
  *Columns = kColumns;
  *Rows = kRows;
  return EFI_SUCCESS;
}

EFI_STATUS EFIAPI TextSetMode(EFI_SIMPLE_TEXT_OUTPUT_PROTOCOL *This, UINTN ModeNumber) {
  State &s = Services::Active();
  EFI_STATUS failure;
  if (Refused(s, "TextSetMode", &failure))
    return failure;
  if (FindOutput(s, This) == nullptr)
    return EFI_INVALID_PARAMETER;
  return ModeNumber == 0 ? EFI_SUCCESS : EFI_UNSUPPORTED;
}

EFI_STATUS EFIAPI SetAttribute(EFI_SIMPLE_TEXT_OUTPUT_PROTOCOL *This, UINTN Attribute) {
  State &s = Services::Active();
  EFI_STATUS failure;
  if (Refused(s, "SetAttribute", &failure))
    return failure;
  TextOutput *output = FindOutput(s, This);
  if (output == nullptr)
    return EFI_INVALID_PARAMETER;
  if (Attribute > 0x7F)
    return EFI_UNSUPPORTED;
  output->mode.Attribute = INT32(Attribute);
  return EFI_SUCCESS;
}

EFI_STATUS EFIAPI ClearScreen(EFI_SIMPLE_TEXT_OUTPUT_PROTOCOL *This) {
  State &s = Services::Active();
  EFI_STATUS failure;
  if (Refused(s, "ClearScreen", &failure))
    return failure;
  TextOutput *output = FindOutput(s, This);
  if (output == nullptr)
    return EFI_INVALID_PARAMETER;
  output->mode.CursorColumn = 0;
  output->mode.CursorRow = 0;
  return EFI_SUCCESS;
}

EFI_STATUS EFIAPI SetCursorPosition(EFI_SIMPLE_TEXT_OUTPUT_PROTOCOL *This, UINTN Column, UINTN Row) {
  State &s = Services::Active();
  EFI_STATUS failure;
  if (Refused(s, "SetCursorPosition", &failure))
    return failure;
  TextOutput *output = FindOutput(s, This);
  if (output == nullptr)
    return EFI_INVALID_PARAMETER;
  if (Column >= kColumns || Row >= kRows)
    return EFI_UNSUPPORTED;
  output->mode.CursorColumn = INT32(Column);
  output->mode.CursorRow = INT32(Row);
  return EFI_SUCCESS;
}

EFI_STATUS EFIAPI EnableCursor(EFI_SIMPLE_TEXT_OUTPUT_PROTOCOL *This, BOOLEAN Visible) {
  State &s = Services::Active();
  EFI_STATUS failure;
  if (Refused(s, "EnableCursor", &failure))
    return failure;
  TextOutput *output = FindOutput(s, This);
  if (output == nullptr)
    return EFI_INVALID_PARAMETER;
  output->mode.CursorVisible = Visible;
  return EFI_SUCCESS;
}

void InitTextOutput(State &s, TextOutput &output, EFI_HANDLE *handle) {
  EFI_SIMPLE_TEXT_OUTPUT_PROTOCOL &p = output.protocol;
  p.Reset = TextReset;
  p.OutputString = OutputString;
  p.TestString = reinterpret_cast<void *>(TestString);
  p.QueryMode = reinterpret_cast<void *>(QueryMode);
  p.SetMode = reinterpret_cast<void *>(TextSetMode);
  p.SetAttribute = SetAttribute;
  p.ClearScreen = ClearScreen;
  p.SetCursorPosition = reinterpret_cast<void *>(SetCursorPosition);
  p.EnableCursor = EnableCursor;
  p.Mode = &output.mode;
  output.mode.MaxMode = 1;
  output.mode.Mode = 0;
  output.mode.Attribute = 0x07;  // light grey on black
  output.mode.CursorVisible = TRUE;
  *handle = AddHandle(s);
  PutInterface(s, *handle, gEfiSimpleTextOutProtocolGuid, &p);
}

// --- Console control ----------------------------------------------------------------

EFI_STATUS EFIAPI GetMode(EFI_CONSOLE_CONTROL_PROTOCOL *This, EFI_CONSOLE_CONTROL_SCREEN_MODE *Mode,
                          BOOLEAN *UgaExists, BOOLEAN *StdInLocked) {
  State &s = Services::Active();
  EFI_STATUS failure;
  if (Refused(s, "GetMode", &failure))
    return failure;
  if (This != &s.consoleControl || Mode == nullptr)
    return EFI_INVALID_PARAMETER;
  s.consoleModeCalls.push_back({false, s.consoleMode});
  *Mode = s.consoleMode;
  if (UgaExists != nullptr)
    *UgaExists = TRUE;
  if (StdInLocked != nullptr)
    *StdInLocked = FALSE;
  return EFI_SUCCESS;
}

EFI_STATUS EFIAPI SetMode(EFI_CONSOLE_CONTROL_PROTOCOL *This, EFI_CONSOLE_CONTROL_SCREEN_MODE Mode) {
  State &s = Services::Active();
  EFI_STATUS failure;
  if (Refused(s, "SetMode", &failure))
    return failure;
  if (This != &s.consoleControl || Mode >= EfiConsoleControlScreenMaxValue)
    return EFI_INVALID_PARAMETER;
  s.consoleModeCalls.push_back({true, Mode});
  s.consoleMode = Mode;
  return EFI_SUCCESS;
}

EFI_STATUS EFIAPI LockStdIn(EFI_CONSOLE_CONTROL_PROTOCOL *This, CHAR16 *) {
  State &s = Services::Active();
  EFI_STATUS failure;
  if (Refused(s, "LockStdIn", &failure))
    return failure;
  return This == &s.consoleControl ? EFI_UNSUPPORTED : EFI_INVALID_PARAMETER;
}

}  // namespace

void InitConsoles(State &s) {
  InitTextOutput(s, s.conOut, &s.conOutHandle);
  InitTextOutput(s, s.stdErr, &s.stdErrHandle);
  EFI_SYSTEM_TABLE &st = s.tables->system;
  st.ConsoleOutHandle = s.conOutHandle;
  st.ConOut = &s.conOut.protocol;
  st.StandardErrorHandle = s.stdErrHandle;
  st.StdErr = &s.stdErr.protocol;

  s.consoleControl = {GetMode, SetMode, LockStdIn};
  s.consoleControlHandle = AddHandle(s);
  PutInterface(s, s.consoleControlHandle, gEfiConsoleControlProtocolGuid, &s.consoleControl);
}

const std::vector<std::u16string> &Firmware::ConOutCalls() const {
  return s_->conOut.calls;
}
const std::vector<std::u16string> &Firmware::StdErrCalls() const {
  return s_->stdErr.calls;
}

std::string Firmware::ConOutText() const {
  std::string text;
  for (const std::u16string &call : s_->conOut.calls) {
    for (char16_t unit : call) {
      if (unit < 0x80) {
        text += char(unit);
      } else {
        text += "\xEF\xBF\xBD";  // U+FFFD
      }
    }
  }
  return text;
}

void Firmware::SetConOutPresent(bool present) {
  s_->tables->system.ConOut = present ? &s_->conOut.protocol : nullptr;
  UpdateSystemTableCrc(*s_);
}

void Firmware::SetStdErrPresent(bool present) {
  s_->tables->system.StdErr = present ? &s_->stdErr.protocol : nullptr;
  UpdateSystemTableCrc(*s_);
}

void Firmware::SetConsoleControlPresent(bool present) {
  if (present) {
    PutInterface(*s_, s_->consoleControlHandle, gEfiConsoleControlProtocolGuid, &s_->consoleControl);
  } else {
    UninstallProtocol(s_->consoleControlHandle, gEfiConsoleControlProtocolGuid);
  }
}

void Firmware::SetConsoleMode(EFI_CONSOLE_CONTROL_SCREEN_MODE mode) {
  s_->consoleMode = mode;
}
EFI_CONSOLE_CONTROL_SCREEN_MODE Firmware::ConsoleMode() const {
  return s_->consoleMode;
}
const std::vector<ConsoleModeCall> &Firmware::ConsoleModeCalls() const {
  return s_->consoleModeCalls;
}

}  // namespace hostfw
