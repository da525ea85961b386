// The Data Hub: records logged by the firmware about the machine, walked by
// monotonic count. As on real firmware, the count handed back with a record
// is that of the next record, and 0 comes back with the last one.
#include <algorithm>
#include <cstring>

#include "hostfw/internal.h"

namespace hostfw {

namespace {

// The first record's count; a count of 0 asks for the first record.
constexpr UINT64 kFirstCount = 1;

EFI_STATUS EFIAPI GetNextDataRecord(EFI_DATA_HUB_PROTOCOL *This, UINT64 *MonotonicCount,
                                    EFI_EVENT *FilterDriver, EFI_DATA_RECORD_HEADER **Record) {
  State &s = Services::Active();
  EFI_STATUS failure;
  if (Refused(s, "GetNextDataRecord", &failure))
    return failure;
  DataHub *hub = s.dataHub.get();
  if (hub == nullptr || This != &hub->protocol || MonotonicCount == nullptr || Record == nullptr)
    return EFI_INVALID_PARAMETER;
  // No filter driver is ever registered here.
  if (FilterDriver != nullptr)
    return EFI_INVALID_PARAMETER;
  const UINT64 index = *MonotonicCount == 0 ? 0 : *MonotonicCount - kFirstCount;
  if (index >= hub->records.size())
    return EFI_NOT_FOUND;
  *Record = reinterpret_cast<EFI_DATA_RECORD_HEADER *>(hub->records[index].data());
  *MonotonicCount = index + 1 < hub->records.size() ? index + 1 + kFirstCount : 0;
  return EFI_SUCCESS;
}

DataHub &TheHub(State &s) {
  if (s.dataHub == nullptr) {
    s.dataHub = std::make_unique<DataHub>();
    DataHub &hub = *s.dataHub;
    hub.protocol = {};
    hub.protocol.GetNextDataRecord = GetNextDataRecord;
    hub.handle = AddHandle(s);
    PutInterface(s, hub.handle, gEfiDataHubProtocolGuid, &hub.protocol);
  }
  return *s.dataHub;
}

template <typename T>
void Put(std::vector<uint8_t> &bytes, T value) {
  const auto *raw = reinterpret_cast<const uint8_t *>(&value);
  bytes.insert(bytes.end(), raw, raw + sizeof(T));
}

}  // namespace

// --- The test's view --------------------------------------------------------------

void Firmware::AddDataHubRecordData(const EFI_GUID &producer, const std::vector<uint8_t> &data) {
  DataHub &hub = TheHub(*s_);
  if (sizeof(EFI_DATA_RECORD_HEADER) + data.size() > UINT32(~0U))
    Misuse("a Data Hub record of %zu bytes", data.size());
  EFI_DATA_RECORD_HEADER header = {};
  header.Version = EFI_DATA_RECORD_HEADER_VERSION;
  header.HeaderSize = sizeof(EFI_DATA_RECORD_HEADER);
  header.RecordSize = UINT32(sizeof(EFI_DATA_RECORD_HEADER) + data.size());
  // A class GUID of the producer's own, different from its name.
  header.DataRecordGuid = producer;
  header.DataRecordGuid.Data1 ^= 0xFFFFFFFF;
  header.ProducerName = producer;
  header.DataRecordClass = EFI_DATA_RECORD_CLASS_DATA;
  header.LogTime = EfiTimeFromSeconds(0);
  header.LogMonotonicCount = hub.records.size() + kFirstCount;

  // Exactly as long as the record, so that a read past it shows.
  std::vector<uint8_t> record(header.RecordSize);
  std::memcpy(record.data(), &header, sizeof(header));
  std::copy(data.begin(), data.end(), record.begin() + sizeof(header));
  hub.records.push_back(std::move(record));
}

void Firmware::AddDataHubRecord(const EFI_GUID &producer, const std::u16string &name,
                                const std::vector<uint8_t> &value) {
  std::vector<uint8_t> data;
  // The producer's own sub-header, which readers of the record skip.
  for (uint8_t i = 0; i < 16; i++)
    data.push_back(uint8_t(0xA0 + i));
  Put<UINT32>(data, UINT32((name.size() + 1) * sizeof(char16_t)));
  Put<UINT32>(data, UINT32(value.size()));
  for (char16_t unit : name)
    Put<UINT16>(data, unit);
  Put<UINT16>(data, 0);
  data.insert(data.end(), value.begin(), value.end());
  AddDataHubRecordData(producer, data);
}

}  // namespace hostfw
