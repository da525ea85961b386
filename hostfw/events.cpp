// Events and timers, task priority levels, and the firmware's clock services.
// Time does not pass on its own here: a timer fires when the test says so.
#include <cstdio>

#include "hostfw/internal.h"

namespace hostfw {

namespace {

EventRecord *FindEvent(State &s, EFI_EVENT event) {
  for (const auto &token : s.eventTokens) {
    if (token.get() == event)
      return &s.events[token->index];
  }
  return nullptr;
}

EFI_STATUS EFIAPI CreateEvent(UINT32 Type, EFI_TPL NotifyTpl, EFI_EVENT_NOTIFY NotifyFunction,
                              VOID *NotifyContext, EFI_EVENT *Event) {
  State &s = Services::Active();
  EFI_STATUS failure;
  if (Refused(s, "CreateEvent", &failure))
    return failure;
  if (Event == nullptr)
    return EFI_INVALID_PARAMETER;
  const UINT32 notify = Type & (EVT_NOTIFY_WAIT | EVT_NOTIFY_SIGNAL);
  if (notify == (EVT_NOTIFY_WAIT | EVT_NOTIFY_SIGNAL))
    return EFI_INVALID_PARAMETER;
  if (notify != 0 &&
      (NotifyFunction == nullptr || NotifyTpl <= TPL_APPLICATION || NotifyTpl >= TPL_HIGH_LEVEL)) {
    return EFI_INVALID_PARAMETER;
  }
  s.eventTokens.push_back(std::make_unique<EventToken>(EventToken{s.events.size()}));
  EventRecord record;
  record.event = s.eventTokens.back().get();
  record.type = Type;
  record.tpl = NotifyTpl;
  record.notify = NotifyFunction;
  record.context = NotifyContext;
  s.events.push_back(record);
  *Event = record.event;
  return EFI_SUCCESS;
}

EFI_STATUS EFIAPI SetTimer(EFI_EVENT Event, EFI_TIMER_DELAY Type, UINT64 TriggerTime) {
  State &s = Services::Active();
  EFI_STATUS failure;
  if (Refused(s, "SetTimer", &failure))
    return failure;
  EventRecord *record = FindEvent(s, Event);
  if (record == nullptr || record->closed || (record->type & EVT_TIMER) == 0 || Type > TimerRelative) {
    return EFI_INVALID_PARAMETER;
  }
  record->timerType = Type;
  record->triggerTime = TriggerTime;
  return EFI_SUCCESS;
}

EFI_STATUS EFIAPI CloseEvent(EFI_EVENT Event) {
  State &s = Services::Active();
  EFI_STATUS failure;
  if (Refused(s, "CloseEvent", &failure))
    return failure;
  EventRecord *record = FindEvent(s, Event);
  if (record == nullptr || record->closed)
    return EFI_INVALID_PARAMETER;
  record->closed = true;
  return EFI_SUCCESS;
}

EFI_TPL EFIAPI RaiseTPL(EFI_TPL NewTpl) {
  State &s = Services::Active();
  EFI_STATUS failure;
  EFI_TPL old = s.tpl;
  if (!Refused(s, "RaiseTPL", &failure))
    s.tpl = NewTpl;
  return old;
}

VOID EFIAPI RestoreTPL(EFI_TPL OldTpl) {
  State &s = Services::Active();
  EFI_STATUS failure;
  if (!Refused(s, "RestoreTPL", &failure))
    s.tpl = OldTpl;
}

EFI_STATUS EFIAPI Stall(UINTN) {
  State &s = Services::Active();
  EFI_STATUS failure;
  if (Refused(s, "Stall", &failure))
    return failure;
  return EFI_SUCCESS;
}

EFI_STATUS EFIAPI SetWatchdogTimer(UINTN, UINT64, UINTN, CHAR16 *) {
  State &s = Services::Active();
  EFI_STATUS failure;
  if (Refused(s, "SetWatchdogTimer", &failure))
    return failure;
  return EFI_SUCCESS;
}

// Waiting needs time to pass, which it does not here.
EFI_STATUS EFIAPI WaitForEvent() {
  return Unprovided("WaitForEvent");
}
EFI_STATUS EFIAPI SignalEvent() {
  return Unprovided("SignalEvent");
}
EFI_STATUS EFIAPI CheckEvent() {
  return Unprovided("CheckEvent");
}

}  // namespace

void InstallEventServices(EFI_BOOT_SERVICES &bs) {
  bs.RaiseTPL = RaiseTPL;
  bs.RestoreTPL = RestoreTPL;
  bs.CreateEvent = CreateEvent;
  bs.SetTimer = SetTimer;
  bs.WaitForEvent = reinterpret_cast<void *>(WaitForEvent);
  bs.SignalEvent = reinterpret_cast<void *>(SignalEvent);
  bs.CloseEvent = CloseEvent;
  bs.CheckEvent = reinterpret_cast<void *>(CheckEvent);
  bs.Stall = Stall;
  bs.SetWatchdogTimer = SetWatchdogTimer;
}

const std::vector<EventRecord> &Firmware::Events() const {
  return s_->events;
}

void Firmware::FireEvent(EFI_EVENT event) {
  State &s = *s_;
  EventRecord *record = FindEvent(s, event);
  if (record == nullptr)
    Misuse("FireEvent of an event that this firmware did not make");
  bool cancelled = (record->type & EVT_TIMER) != 0 && record->timerType == TimerCancel;
  if (record->closed || cancelled || s.exited || record->notify == nullptr)
    return;
  // The notify function runs at the event's level, as the firmware runs it.
  EFI_TPL before = s.tpl;
  s.tpl = record->tpl;
  record->notify(record->event, record->context);
  s.tpl = before;
}

}  // namespace hostfw
