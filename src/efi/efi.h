// The loader's own UEFI definitions: only what the loader, the platform layer
// and the host firmware use. Names are spelled as the UEFI standard spells
// them. Function slots that nobody calls are typed `void *` so that every
// table keeps its exact layout; the layouts are checked at the end.
#pragma once

#include <stddef.h>
#include <stdint.h>

// The firmware's calling convention. It is the default of the EFI target and
// must be spelled out for the host build, where hostfw/ implements the tables.
#define EFIAPI __attribute__((ms_abi))

typedef uint8_t UINT8;
typedef int8_t INT8;
typedef uint16_t UINT16;
typedef int16_t INT16;
typedef uint32_t UINT32;
typedef int32_t INT32;
typedef uint64_t UINT64;
typedef int64_t INT64;
typedef uint64_t UINTN;
typedef int64_t INTN;
typedef char16_t CHAR16;
typedef char CHAR8;
typedef uint8_t BOOLEAN;
typedef void VOID;

typedef UINTN EFI_STATUS;
typedef void *EFI_HANDLE;
typedef void *EFI_EVENT;
typedef UINTN EFI_TPL;
typedef UINT64 EFI_PHYSICAL_ADDRESS;
typedef UINT64 EFI_VIRTUAL_ADDRESS;

#define TRUE ((BOOLEAN)1)
#define FALSE ((BOOLEAN)0)

struct EFI_GUID {
  UINT32 Data1;
  UINT16 Data2;
  UINT16 Data3;
  UINT8 Data4[8];
};

// ---------------------------------------------------------------------------
// Status codes. An error has the top bit set and tests negative.

#define EFI_ERROR_BIT 0x8000000000000000ULL
#define EFIERR(a) (EFI_ERROR_BIT | (a))
#define EFI_ERROR(s) (((INTN)(EFI_STATUS)(s)) < 0)

#define EFI_SUCCESS 0ULL
#define EFI_LOAD_ERROR EFIERR(1)
#define EFI_INVALID_PARAMETER EFIERR(2)
#define EFI_UNSUPPORTED EFIERR(3)
#define EFI_BAD_BUFFER_SIZE EFIERR(4)
#define EFI_BUFFER_TOO_SMALL EFIERR(5)
#define EFI_NOT_READY EFIERR(6)
#define EFI_DEVICE_ERROR EFIERR(7)
#define EFI_WRITE_PROTECTED EFIERR(8)
#define EFI_OUT_OF_RESOURCES EFIERR(9)
#define EFI_VOLUME_CORRUPTED EFIERR(10)
#define EFI_VOLUME_FULL EFIERR(11)
#define EFI_NO_MEDIA EFIERR(12)
#define EFI_MEDIA_CHANGED EFIERR(13)
#define EFI_NOT_FOUND EFIERR(14)
#define EFI_ACCESS_DENIED EFIERR(15)
#define EFI_NO_RESPONSE EFIERR(16)
#define EFI_NO_MAPPING EFIERR(17)
#define EFI_TIMEOUT EFIERR(18)
#define EFI_NOT_STARTED EFIERR(19)
#define EFI_ALREADY_STARTED EFIERR(20)
#define EFI_ABORTED EFIERR(21)
#define EFI_ICMP_ERROR EFIERR(22)
#define EFI_TFTP_ERROR EFIERR(23)
#define EFI_PROTOCOL_ERROR EFIERR(24)
#define EFI_INCOMPATIBLE_VERSION EFIERR(25)
#define EFI_SECURITY_VIOLATION EFIERR(26)
#define EFI_CRC_ERROR EFIERR(27)
#define EFI_END_OF_MEDIA EFIERR(28)
#define EFI_END_OF_FILE EFIERR(31)

// ---------------------------------------------------------------------------
// Memory.

enum EFI_ALLOCATE_TYPE : UINT32 { AllocateAnyPages, AllocateMaxAddress, AllocateAddress, MaxAllocateType };

enum EFI_MEMORY_TYPE : UINT32 {
  EfiReservedMemoryType,
  EfiLoaderCode,
  EfiLoaderData,
  EfiBootServicesCode,
  EfiBootServicesData,
  EfiRuntimeServicesCode,
  EfiRuntimeServicesData,
  EfiConventionalMemory,
  EfiUnusableMemory,
  EfiACPIReclaimMemory,
  EfiACPIMemoryNVS,
  EfiMemoryMappedIO,
  EfiMemoryMappedIOPortSpace,
  EfiPalCode,
  EfiMaxMemoryType
};

#define EFI_PAGE_SIZE 4096ULL
#define EFI_PAGE_SHIFT 12
#define EFI_SIZE_TO_PAGES(s) (((UINT64)(s) + EFI_PAGE_SIZE - 1) >> EFI_PAGE_SHIFT)

#define EFI_MEMORY_UC 0x0000000000000001ULL
#define EFI_MEMORY_WC 0x0000000000000002ULL
#define EFI_MEMORY_WT 0x0000000000000004ULL
#define EFI_MEMORY_WB 0x0000000000000008ULL
#define EFI_MEMORY_RUNTIME 0x8000000000000000ULL

struct EFI_MEMORY_DESCRIPTOR {
  UINT32 Type;
  UINT32 Pad;
  EFI_PHYSICAL_ADDRESS PhysicalStart;
  EFI_VIRTUAL_ADDRESS VirtualStart;
  UINT64 NumberOfPages;
  UINT64 Attribute;
};

#define EFI_MEMORY_DESCRIPTOR_VERSION 1

// ---------------------------------------------------------------------------
// Events and timers.

#define EVT_TIMER 0x80000000U
#define EVT_RUNTIME 0x40000000U
#define EVT_NOTIFY_WAIT 0x00000100U
#define EVT_NOTIFY_SIGNAL 0x00000200U
#define EVT_SIGNAL_EXIT_BOOT_SERVICES 0x00000201U

#define TPL_APPLICATION 4
#define TPL_CALLBACK 8
#define TPL_NOTIFY 16
#define TPL_HIGH_LEVEL 31

enum EFI_TIMER_DELAY : UINT32 { TimerCancel, TimerPeriodic, TimerRelative };

typedef VOID(EFIAPI *EFI_EVENT_NOTIFY)(EFI_EVENT Event, VOID *Context);

// ---------------------------------------------------------------------------
// Handles and protocols.

enum EFI_LOCATE_SEARCH_TYPE : UINT32 { AllHandles, ByRegisterNotify, ByProtocol };

enum EFI_INTERFACE_TYPE : UINT32 { EFI_NATIVE_INTERFACE };

enum EFI_RESET_TYPE : UINT32 { EfiResetCold, EfiResetWarm, EfiResetShutdown, EfiResetPlatformSpecific };

struct EFI_TIME {
  UINT16 Year;
  UINT8 Month;
  UINT8 Day;
  UINT8 Hour;
  UINT8 Minute;
  UINT8 Second;
  UINT8 Pad1;
  UINT32 Nanosecond;
  INT16 TimeZone;
  UINT8 Daylight;
  UINT8 Pad2;
};

struct EFI_TABLE_HEADER {
  UINT64 Signature;
  UINT32 Revision;
  UINT32 HeaderSize;
  UINT32 CRC32;
  UINT32 Reserved;
};

#define EFI_SYSTEM_TABLE_SIGNATURE 0x5453595320494249ULL      // "IBI SYST"
#define EFI_BOOT_SERVICES_SIGNATURE 0x56524553544f4f42ULL     // "BOOTSERV"
#define EFI_RUNTIME_SERVICES_SIGNATURE 0x56524553544e5552ULL  // "RUNTSERV"

// Device path node, as laid out on the wire: nodes are not aligned, so the
// length is two bytes.
struct EFI_DEVICE_PATH_PROTOCOL {
  UINT8 Type;
  UINT8 SubType;
  UINT8 Length[2];
};

#define HARDWARE_DEVICE_PATH 0x01
#define ACPI_DEVICE_PATH 0x02
#define MESSAGING_DEVICE_PATH 0x03
#define MEDIA_DEVICE_PATH 0x04
#define BBS_DEVICE_PATH 0x05
#define END_DEVICE_PATH_TYPE 0x7F
#define END_ENTIRE_DEVICE_PATH_SUBTYPE 0xFF
#define END_INSTANCE_DEVICE_PATH_SUBTYPE 0x01
#define MSG_MAC_ADDR_DP 0x0B
#define MEDIA_HARDDRIVE_DP 0x01
#define MEDIA_FILEPATH_DP 0x04

// ---------------------------------------------------------------------------
// Text output.

struct EFI_SIMPLE_TEXT_OUTPUT_PROTOCOL;

struct SIMPLE_TEXT_OUTPUT_MODE {
  INT32 MaxMode;
  INT32 Mode;
  INT32 Attribute;
  INT32 CursorColumn;
  INT32 CursorRow;
  BOOLEAN CursorVisible;
};

struct EFI_SIMPLE_TEXT_OUTPUT_PROTOCOL {
  EFI_STATUS(EFIAPI *Reset)(EFI_SIMPLE_TEXT_OUTPUT_PROTOCOL *This, BOOLEAN ExtendedVerification);
  EFI_STATUS(EFIAPI *OutputString)(EFI_SIMPLE_TEXT_OUTPUT_PROTOCOL *This, const CHAR16 *String);
  void *TestString;
  void *QueryMode;
  void *SetMode;
  EFI_STATUS(EFIAPI *SetAttribute)(EFI_SIMPLE_TEXT_OUTPUT_PROTOCOL *This, UINTN Attribute);
  EFI_STATUS(EFIAPI *ClearScreen)(EFI_SIMPLE_TEXT_OUTPUT_PROTOCOL *This);
  void *SetCursorPosition;
  EFI_STATUS(EFIAPI *EnableCursor)(EFI_SIMPLE_TEXT_OUTPUT_PROTOCOL *This, BOOLEAN Visible);
  SIMPLE_TEXT_OUTPUT_MODE *Mode;
};

// ---------------------------------------------------------------------------
// Runtime services.

struct EFI_RUNTIME_SERVICES {
  EFI_TABLE_HEADER Hdr;
  void *GetTime;
  void *SetTime;
  void *GetWakeupTime;
  void *SetWakeupTime;
  EFI_STATUS(EFIAPI *SetVirtualAddressMap)
  (UINTN MemoryMapSize, UINTN DescriptorSize, UINT32 DescriptorVersion, EFI_MEMORY_DESCRIPTOR *VirtualMap);
  void *ConvertPointer;
  EFI_STATUS(EFIAPI *GetVariable)
  (const CHAR16 *VariableName, const EFI_GUID *VendorGuid, UINT32 *Attributes, UINTN *DataSize, VOID *Data);
  EFI_STATUS(EFIAPI *GetNextVariableName)
  (UINTN *VariableNameSize, CHAR16 *VariableName, EFI_GUID *VendorGuid);
  EFI_STATUS(EFIAPI *SetVariable)
  (const CHAR16 *VariableName, const EFI_GUID *VendorGuid, UINT32 Attributes, UINTN DataSize,
   const VOID *Data);
  void *GetNextHighMonotonicCount;
  VOID(EFIAPI *ResetSystem)
  (EFI_RESET_TYPE ResetType, EFI_STATUS ResetStatus, UINTN DataSize, const VOID *ResetData);
  void *UpdateCapsule;
  void *QueryCapsuleCapabilities;
  void *QueryVariableInfo;
};

#define EFI_VARIABLE_NON_VOLATILE 0x00000001U
#define EFI_VARIABLE_BOOTSERVICE_ACCESS 0x00000002U
#define EFI_VARIABLE_RUNTIME_ACCESS 0x00000004U

// ---------------------------------------------------------------------------
// Boot services.

struct EFI_BOOT_SERVICES {
  EFI_TABLE_HEADER Hdr;
  EFI_TPL(EFIAPI *RaiseTPL)(EFI_TPL NewTpl);
  VOID(EFIAPI *RestoreTPL)(EFI_TPL OldTpl);
  EFI_STATUS(EFIAPI *AllocatePages)
  (EFI_ALLOCATE_TYPE Type, EFI_MEMORY_TYPE MemoryType, UINTN Pages, EFI_PHYSICAL_ADDRESS *Memory);
  EFI_STATUS(EFIAPI *FreePages)(EFI_PHYSICAL_ADDRESS Memory, UINTN Pages);
  EFI_STATUS(EFIAPI *GetMemoryMap)
  (UINTN *MemoryMapSize, EFI_MEMORY_DESCRIPTOR *MemoryMap, UINTN *MapKey, UINTN *DescriptorSize,
   UINT32 *DescriptorVersion);
  EFI_STATUS(EFIAPI *AllocatePool)(EFI_MEMORY_TYPE PoolType, UINTN Size, VOID **Buffer);
  EFI_STATUS(EFIAPI *FreePool)(VOID *Buffer);
  EFI_STATUS(EFIAPI *CreateEvent)
  (UINT32 Type, EFI_TPL NotifyTpl, EFI_EVENT_NOTIFY NotifyFunction, VOID *NotifyContext, EFI_EVENT *Event);
  EFI_STATUS(EFIAPI *SetTimer)(EFI_EVENT Event, EFI_TIMER_DELAY Type, UINT64 TriggerTime);
  void *WaitForEvent;
  void *SignalEvent;
  EFI_STATUS(EFIAPI *CloseEvent)(EFI_EVENT Event);
  void *CheckEvent;
  EFI_STATUS(EFIAPI *InstallProtocolInterface)
  (EFI_HANDLE *Handle, const EFI_GUID *Protocol, EFI_INTERFACE_TYPE InterfaceType, VOID *Interface);
  void *ReinstallProtocolInterface;
  void *UninstallProtocolInterface;
  EFI_STATUS(EFIAPI *HandleProtocol)(EFI_HANDLE Handle, const EFI_GUID *Protocol, VOID **Interface);
  void *Reserved;
  void *RegisterProtocolNotify;
  void *LocateHandle;
  void *LocateDevicePath;
  void *InstallConfigurationTable;
  EFI_STATUS(EFIAPI *LoadImage)
  (BOOLEAN BootPolicy, EFI_HANDLE ParentImageHandle, EFI_DEVICE_PATH_PROTOCOL *DevicePath, VOID *SourceBuffer,
   UINTN SourceSize, EFI_HANDLE *ImageHandle);
  EFI_STATUS(EFIAPI *StartImage)(EFI_HANDLE ImageHandle, UINTN *ExitDataSize, CHAR16 **ExitData);
  EFI_STATUS(EFIAPI *Exit)
  (EFI_HANDLE ImageHandle, EFI_STATUS ExitStatus, UINTN ExitDataSize, CHAR16 *ExitData);
  void *UnloadImage;
  EFI_STATUS(EFIAPI *ExitBootServices)(EFI_HANDLE ImageHandle, UINTN MapKey);
  void *GetNextMonotonicCount;
  EFI_STATUS(EFIAPI *Stall)(UINTN Microseconds);
  EFI_STATUS(EFIAPI *SetWatchdogTimer)
  (UINTN Timeout, UINT64 WatchdogCode, UINTN DataSize, CHAR16 *WatchdogData);
  void *ConnectController;
  void *DisconnectController;
  void *OpenProtocol;
  void *CloseProtocol;
  void *OpenProtocolInformation;
  void *ProtocolsPerHandle;
  EFI_STATUS(EFIAPI *LocateHandleBuffer)
  (EFI_LOCATE_SEARCH_TYPE SearchType, const EFI_GUID *Protocol, VOID *SearchKey, UINTN *NoHandles,
   EFI_HANDLE **Buffer);
  EFI_STATUS(EFIAPI *LocateProtocol)(const EFI_GUID *Protocol, VOID *Registration, VOID **Interface);
  void *InstallMultipleProtocolInterfaces;
  void *UninstallMultipleProtocolInterfaces;
  void *CalculateCrc32;
  VOID(EFIAPI *CopyMem)(VOID *Destination, const VOID *Source, UINTN Length);
  VOID(EFIAPI *SetMem)(VOID *Buffer, UINTN Size, UINT8 Value);
  void *CreateEventEx;
};

// ---------------------------------------------------------------------------
// System table.

struct EFI_CONFIGURATION_TABLE {
  EFI_GUID VendorGuid;
  VOID *VendorTable;
};

struct EFI_SYSTEM_TABLE {
  EFI_TABLE_HEADER Hdr;
  CHAR16 *FirmwareVendor;
  UINT32 FirmwareRevision;
  EFI_HANDLE ConsoleInHandle;
  void *ConIn;
  EFI_HANDLE ConsoleOutHandle;
  EFI_SIMPLE_TEXT_OUTPUT_PROTOCOL *ConOut;
  EFI_HANDLE StandardErrorHandle;
  EFI_SIMPLE_TEXT_OUTPUT_PROTOCOL *StdErr;
  EFI_RUNTIME_SERVICES *RuntimeServices;
  EFI_BOOT_SERVICES *BootServices;
  UINTN NumberOfTableEntries;
  EFI_CONFIGURATION_TABLE *ConfigurationTable;
};

typedef EFI_STATUS(EFIAPI *EFI_IMAGE_ENTRY_POINT)(EFI_HANDLE ImageHandle, EFI_SYSTEM_TABLE *SystemTable);

// ---------------------------------------------------------------------------
// Loaded image.

struct EFI_LOADED_IMAGE_PROTOCOL {
  UINT32 Revision;
  EFI_HANDLE ParentHandle;
  EFI_SYSTEM_TABLE *SystemTable;
  EFI_HANDLE DeviceHandle;
  EFI_DEVICE_PATH_PROTOCOL *FilePath;
  VOID *Reserved;
  UINT32 LoadOptionsSize;
  VOID *LoadOptions;
  VOID *ImageBase;
  UINT64 ImageSize;
  EFI_MEMORY_TYPE ImageCodeType;
  EFI_MEMORY_TYPE ImageDataType;
  EFI_STATUS(EFIAPI *Unload)(EFI_HANDLE ImageHandle);
};

// ---------------------------------------------------------------------------
// Files.

#define EFI_FILE_MODE_READ 0x0000000000000001ULL
#define EFI_FILE_MODE_WRITE 0x0000000000000002ULL
#define EFI_FILE_MODE_CREATE 0x8000000000000000ULL

#define EFI_FILE_READ_ONLY 0x01ULL
#define EFI_FILE_HIDDEN 0x02ULL
#define EFI_FILE_SYSTEM 0x04ULL
#define EFI_FILE_DIRECTORY 0x10ULL
#define EFI_FILE_ARCHIVE 0x20ULL

struct EFI_FILE_PROTOCOL {
  UINT64 Revision;
  EFI_STATUS(EFIAPI *Open)
  (EFI_FILE_PROTOCOL *This, EFI_FILE_PROTOCOL **NewHandle, const CHAR16 *FileName, UINT64 OpenMode,
   UINT64 Attributes);
  EFI_STATUS(EFIAPI *Close)(EFI_FILE_PROTOCOL *This);
  void *Delete;
  EFI_STATUS(EFIAPI *Read)(EFI_FILE_PROTOCOL *This, UINTN *BufferSize, VOID *Buffer);
  void *Write;
  EFI_STATUS(EFIAPI *GetPosition)(EFI_FILE_PROTOCOL *This, UINT64 *Position);
  EFI_STATUS(EFIAPI *SetPosition)(EFI_FILE_PROTOCOL *This, UINT64 Position);
  EFI_STATUS(EFIAPI *GetInfo)
  (EFI_FILE_PROTOCOL *This, const EFI_GUID *InformationType, UINTN *BufferSize, VOID *Buffer);
  void *SetInfo;
  void *Flush;
};

typedef EFI_FILE_PROTOCOL EFI_FILE;

struct EFI_FILE_INFO {
  UINT64 Size;
  UINT64 FileSize;
  UINT64 PhysicalSize;
  EFI_TIME CreateTime;
  EFI_TIME LastAccessTime;
  EFI_TIME ModificationTime;
  UINT64 Attribute;
  CHAR16 FileName[1];
};

#define SIZE_OF_EFI_FILE_INFO offsetof(EFI_FILE_INFO, FileName)

struct EFI_SIMPLE_FILE_SYSTEM_PROTOCOL {
  UINT64 Revision;
  EFI_STATUS(EFIAPI *OpenVolume)(EFI_SIMPLE_FILE_SYSTEM_PROTOCOL *This, EFI_FILE_PROTOCOL **Root);
};

struct EFI_LOAD_FILE_PROTOCOL {
  EFI_STATUS(EFIAPI *LoadFile)
  (EFI_LOAD_FILE_PROTOCOL *This, EFI_DEVICE_PATH_PROTOCOL *FilePath, BOOLEAN BootPolicy, UINTN *BufferSize,
   VOID *Buffer);
};

typedef EFI_LOAD_FILE_PROTOCOL EFI_LOAD_FILE_INTERFACE;

// ---------------------------------------------------------------------------
// Block and disk access.

struct EFI_BLOCK_IO_MEDIA {
  UINT32 MediaId;
  BOOLEAN RemovableMedia;
  BOOLEAN MediaPresent;
  BOOLEAN LogicalPartition;
  BOOLEAN ReadOnly;
  BOOLEAN WriteCaching;
  UINT32 BlockSize;
  UINT32 IoAlign;
  UINT64 LastBlock;
};

struct EFI_BLOCK_IO_PROTOCOL {
  UINT64 Revision;
  EFI_BLOCK_IO_MEDIA *Media;
  EFI_STATUS(EFIAPI *Reset)(EFI_BLOCK_IO_PROTOCOL *This, BOOLEAN ExtendedVerification);
  EFI_STATUS(EFIAPI *ReadBlocks)
  (EFI_BLOCK_IO_PROTOCOL *This, UINT32 MediaId, UINT64 Lba, UINTN BufferSize, VOID *Buffer);
  void *WriteBlocks;
  void *FlushBlocks;
};

struct EFI_DISK_IO_PROTOCOL {
  UINT64 Revision;
  EFI_STATUS(EFIAPI *ReadDisk)
  (EFI_DISK_IO_PROTOCOL *This, UINT32 MediaId, UINT64 Offset, UINTN BufferSize, VOID *Buffer);
  void *WriteDisk;
};

// ---------------------------------------------------------------------------
// Console control: the vendor's switch between the text console and the
// graphics screen. Mode values are the protocol's own.

enum EFI_CONSOLE_CONTROL_SCREEN_MODE : UINT32 {
  EfiConsoleControlScreenText,
  EfiConsoleControlScreenGraphics,
  EfiConsoleControlScreenMaxValue
};

struct EFI_CONSOLE_CONTROL_PROTOCOL {
  EFI_STATUS(EFIAPI *GetMode)
  (EFI_CONSOLE_CONTROL_PROTOCOL *This, EFI_CONSOLE_CONTROL_SCREEN_MODE *Mode, BOOLEAN *UgaExists,
   BOOLEAN *StdInLocked);
  EFI_STATUS(EFIAPI *SetMode)(EFI_CONSOLE_CONTROL_PROTOCOL *This, EFI_CONSOLE_CONTROL_SCREEN_MODE Mode);
  EFI_STATUS(EFIAPI *LockStdIn)(EFI_CONSOLE_CONTROL_PROTOCOL *This, CHAR16 *Password);
};

// ---------------------------------------------------------------------------
// Graphics output (the firmware's own; the platform layer builds on it).

struct EFI_PIXEL_BITMASK {
  UINT32 RedMask;
  UINT32 GreenMask;
  UINT32 BlueMask;
  UINT32 ReservedMask;
};

enum EFI_GRAPHICS_PIXEL_FORMAT : UINT32 {
  PixelRedGreenBlueReserved8BitPerColor,
  PixelBlueGreenRedReserved8BitPerColor,
  PixelBitMask,
  PixelBltOnly,
  PixelFormatMax
};

struct EFI_GRAPHICS_OUTPUT_MODE_INFORMATION {
  UINT32 Version;
  UINT32 HorizontalResolution;
  UINT32 VerticalResolution;
  EFI_GRAPHICS_PIXEL_FORMAT PixelFormat;
  EFI_PIXEL_BITMASK PixelInformation;
  UINT32 PixelsPerScanLine;
};

struct EFI_GRAPHICS_OUTPUT_PROTOCOL_MODE {
  UINT32 MaxMode;
  UINT32 Mode;
  EFI_GRAPHICS_OUTPUT_MODE_INFORMATION *Info;
  UINTN SizeOfInfo;
  EFI_PHYSICAL_ADDRESS FrameBufferBase;
  UINTN FrameBufferSize;
};

struct EFI_GRAPHICS_OUTPUT_BLT_PIXEL {
  UINT8 Blue;
  UINT8 Green;
  UINT8 Red;
  UINT8 Reserved;
};

enum EFI_GRAPHICS_OUTPUT_BLT_OPERATION : UINT32 {
  EfiBltVideoFill,
  EfiBltVideoToBltBuffer,
  EfiBltBufferToVideo,
  EfiBltVideoToVideo,
  EfiGraphicsOutputBltOperationMax
};

struct EFI_GRAPHICS_OUTPUT_PROTOCOL {
  void *QueryMode;
  void *SetMode;
  EFI_STATUS(EFIAPI *Blt)
  (EFI_GRAPHICS_OUTPUT_PROTOCOL *This, EFI_GRAPHICS_OUTPUT_BLT_PIXEL *BltBuffer,
   EFI_GRAPHICS_OUTPUT_BLT_OPERATION BltOperation, UINTN SourceX, UINTN SourceY, UINTN DestinationX,
   UINTN DestinationY, UINTN Width, UINTN Height, UINTN Delta);
  EFI_GRAPHICS_OUTPUT_PROTOCOL_MODE *Mode;
};

// ---------------------------------------------------------------------------
// UGA Draw: the drawing interface of the console's screen that the loader
// paints with. A pixel is blue, green, red and a reserved byte; a Delta of 0
// means rows of Width pixels.

struct EFI_UGA_PIXEL {
  UINT8 Blue;
  UINT8 Green;
  UINT8 Red;
  UINT8 Reserved;
};

enum EFI_UGA_BLT_OPERATION : UINT32 {
  EfiUgaVideoFill,
  EfiUgaVideoToBltBuffer,
  EfiUgaBltBufferToVideo,
  EfiUgaVideoToVideo,
  EfiUgaBltMax
};

struct EFI_UGA_DRAW_PROTOCOL {
  EFI_STATUS(EFIAPI *GetMode)
  (EFI_UGA_DRAW_PROTOCOL *This, UINT32 *HorizontalResolution, UINT32 *VerticalResolution, UINT32 *ColorDepth,
   UINT32 *RefreshRate);
  void *SetMode;
  EFI_STATUS(EFIAPI *Blt)
  (EFI_UGA_DRAW_PROTOCOL *This, EFI_UGA_PIXEL *BltBuffer, EFI_UGA_BLT_OPERATION BltOperation, UINTN SourceX,
   UINTN SourceY, UINTN DestinationX, UINTN DestinationY, UINTN Width, UINTN Height, UINTN Delta);
};

// ---------------------------------------------------------------------------
// GUIDs.

#define EFI_GUID_VALUE(a, b, c, d0, d1, d2, d3, d4, d5, d6, d7) \
  {                                                             \
    a, b, c, {                                                  \
      d0, d1, d2, d3, d4, d5, d6, d7                            \
    }                                                           \
  }

inline const EFI_GUID gEfiLoadedImageProtocolGuid =
    EFI_GUID_VALUE(0x5B1B31A1, 0x9562, 0x11D2, 0x8E, 0x3F, 0x00, 0xA0, 0xC9, 0x69, 0x72, 0x3B);
inline const EFI_GUID gEfiDevicePathProtocolGuid =
    EFI_GUID_VALUE(0x09576E91, 0x6D3F, 0x11D2, 0x8E, 0x39, 0x00, 0xA0, 0xC9, 0x69, 0x72, 0x3B);
inline const EFI_GUID gEfiSimpleFileSystemProtocolGuid =
    EFI_GUID_VALUE(0x964E5B22, 0x6459, 0x11D2, 0x8E, 0x39, 0x00, 0xA0, 0xC9, 0x69, 0x72, 0x3B);
inline const EFI_GUID gEfiFileInfoGuid =
    EFI_GUID_VALUE(0x09576E92, 0x6D3F, 0x11D2, 0x8E, 0x39, 0x00, 0xA0, 0xC9, 0x69, 0x72, 0x3B);
inline const EFI_GUID gEfiLoadFileProtocolGuid =
    EFI_GUID_VALUE(0x56EC3091, 0x954C, 0x11D2, 0x8E, 0x3F, 0x00, 0xA0, 0xC9, 0x69, 0x72, 0x3B);
inline const EFI_GUID gEfiBlockIoProtocolGuid =
    EFI_GUID_VALUE(0x964E5B21, 0x6459, 0x11D2, 0x8E, 0x39, 0x00, 0xA0, 0xC9, 0x69, 0x72, 0x3B);
inline const EFI_GUID gEfiDiskIoProtocolGuid =
    EFI_GUID_VALUE(0xCE345171, 0xBA0B, 0x11D2, 0x8E, 0x4F, 0x00, 0xA0, 0xC9, 0x69, 0x72, 0x3B);
inline const EFI_GUID gEfiSimpleTextOutProtocolGuid =
    EFI_GUID_VALUE(0x387477C2, 0x69C7, 0x11D2, 0x8E, 0x39, 0x00, 0xA0, 0xC9, 0x69, 0x72, 0x3B);
inline const EFI_GUID gEfiGraphicsOutputProtocolGuid =
    EFI_GUID_VALUE(0x9042A9DE, 0x23DC, 0x4A38, 0x96, 0xFB, 0x7A, 0xDE, 0xD0, 0x80, 0x51, 0x6A);
inline const EFI_GUID gEfiUgaDrawProtocolGuid =
    EFI_GUID_VALUE(0x982C298B, 0xF4FA, 0x41CB, 0xB8, 0x38, 0x77, 0xAA, 0x68, 0x8F, 0xB8, 0x39);
inline const EFI_GUID gEfiConsoleControlProtocolGuid =
    EFI_GUID_VALUE(0xF42F7782, 0x012E, 0x4C12, 0x99, 0x56, 0x49, 0xF9, 0x43, 0x04, 0xF7, 0x21);
inline const EFI_GUID gEfiAcpi20TableGuid =
    EFI_GUID_VALUE(0x8868E871, 0xE4F1, 0x11D3, 0xBC, 0x22, 0x00, 0x80, 0xC7, 0x3C, 0x88, 0x81);
inline const EFI_GUID gEfiAcpi10TableGuid =
    EFI_GUID_VALUE(0xEB9D2D30, 0x2D88, 0x11D3, 0x9A, 0x16, 0x00, 0x90, 0x27, 0x3F, 0xC1, 0x4D);

// ---------------------------------------------------------------------------
// Layout checks: these records are defined by the firmware, not by us.

static_assert(sizeof(EFI_GUID) == 16);
static_assert(sizeof(EFI_TABLE_HEADER) == 24);
static_assert(sizeof(EFI_TIME) == 16);
static_assert(sizeof(EFI_DEVICE_PATH_PROTOCOL) == 4);
static_assert(sizeof(EFI_MEMORY_DESCRIPTOR) == 40);
static_assert(offsetof(EFI_MEMORY_DESCRIPTOR, PhysicalStart) == 8);
static_assert(offsetof(EFI_MEMORY_DESCRIPTOR, NumberOfPages) == 24);
static_assert(offsetof(EFI_MEMORY_DESCRIPTOR, Attribute) == 32);
static_assert(offsetof(EFI_SYSTEM_TABLE, FirmwareVendor) == 0x18);
static_assert(offsetof(EFI_SYSTEM_TABLE, FirmwareRevision) == 0x20);
static_assert(offsetof(EFI_SYSTEM_TABLE, ConOut) == 0x40);
static_assert(offsetof(EFI_SYSTEM_TABLE, StdErr) == 0x50);
static_assert(offsetof(EFI_SYSTEM_TABLE, RuntimeServices) == 0x58);
static_assert(offsetof(EFI_SYSTEM_TABLE, BootServices) == 0x60);
static_assert(offsetof(EFI_SYSTEM_TABLE, ConfigurationTable) == 0x70);
static_assert(sizeof(EFI_SYSTEM_TABLE) == 0x78);
static_assert(offsetof(EFI_BOOT_SERVICES, AllocatePages) == 0x28);
static_assert(offsetof(EFI_BOOT_SERVICES, AllocatePool) == 0x40);
static_assert(offsetof(EFI_BOOT_SERVICES, CreateEvent) == 0x50);
static_assert(offsetof(EFI_BOOT_SERVICES, CloseEvent) == 0x70);
static_assert(offsetof(EFI_BOOT_SERVICES, HandleProtocol) == 0x98);
static_assert(offsetof(EFI_BOOT_SERVICES, LoadImage) == 0xC8);
static_assert(offsetof(EFI_BOOT_SERVICES, Exit) == 0xD8);
static_assert(offsetof(EFI_BOOT_SERVICES, ExitBootServices) == 0xE8);
static_assert(offsetof(EFI_BOOT_SERVICES, LocateHandleBuffer) == 0x138);
static_assert(offsetof(EFI_BOOT_SERVICES, LocateProtocol) == 0x140);
static_assert(offsetof(EFI_BOOT_SERVICES, CopyMem) == 0x160);
static_assert(sizeof(EFI_BOOT_SERVICES) == 0x178);
static_assert(offsetof(EFI_RUNTIME_SERVICES, SetVirtualAddressMap) == 0x38);
static_assert(offsetof(EFI_RUNTIME_SERVICES, GetVariable) == 0x48);
static_assert(offsetof(EFI_RUNTIME_SERVICES, SetVariable) == 0x58);
static_assert(offsetof(EFI_RUNTIME_SERVICES, ResetSystem) == 0x68);
static_assert(sizeof(EFI_RUNTIME_SERVICES) == 0x88);
static_assert(offsetof(EFI_SIMPLE_TEXT_OUTPUT_PROTOCOL, OutputString) == 8);
static_assert(offsetof(EFI_SIMPLE_TEXT_OUTPUT_PROTOCOL, Mode) == 0x48);
static_assert(offsetof(EFI_LOADED_IMAGE_PROTOCOL, DeviceHandle) == 0x18);
static_assert(offsetof(EFI_LOADED_IMAGE_PROTOCOL, LoadOptionsSize) == 0x30);
static_assert(offsetof(EFI_LOADED_IMAGE_PROTOCOL, LoadOptions) == 0x38);
static_assert(offsetof(EFI_LOADED_IMAGE_PROTOCOL, ImageCodeType) == 0x50);
static_assert(sizeof(EFI_LOADED_IMAGE_PROTOCOL) == 0x60);
static_assert(offsetof(EFI_FILE_PROTOCOL, Open) == 8);
static_assert(offsetof(EFI_FILE_PROTOCOL, Read) == 0x20);
static_assert(offsetof(EFI_FILE_PROTOCOL, GetInfo) == 0x40);
static_assert(offsetof(EFI_FILE_INFO, ModificationTime) == 0x38);
static_assert(offsetof(EFI_FILE_INFO, Attribute) == 0x48);
static_assert(offsetof(EFI_FILE_INFO, FileName) == 0x50);
static_assert(offsetof(EFI_BLOCK_IO_MEDIA, BlockSize) == 0x0C);
static_assert(offsetof(EFI_BLOCK_IO_MEDIA, LastBlock) == 0x18);
static_assert(offsetof(EFI_BLOCK_IO_PROTOCOL, ReadBlocks) == 0x18);
static_assert(offsetof(EFI_DISK_IO_PROTOCOL, ReadDisk) == 8);
static_assert(offsetof(EFI_GRAPHICS_OUTPUT_PROTOCOL, Mode) == 0x18);
static_assert(offsetof(EFI_GRAPHICS_OUTPUT_PROTOCOL_MODE, FrameBufferBase) == 0x18);
static_assert(sizeof(EFI_GRAPHICS_OUTPUT_MODE_INFORMATION) == 36);
static_assert(sizeof(EFI_UGA_PIXEL) == 4);
static_assert(offsetof(EFI_UGA_PIXEL, Red) == 2);
static_assert(offsetof(EFI_UGA_DRAW_PROTOCOL, Blt) == 0x10);
static_assert(sizeof(EFI_UGA_DRAW_PROTOCOL) == 0x18);
