// The command message exchanged over the service's named pipe, and the
// registry request it may carry. This header depends on nothing but the C++
// standard library, so a user-interface application can include it as it is.
//
// Layout: little-endian, byte offsets from the start of the message. A request
// and its reply share the layout; the reply is the request sent back with the
// result fields filled in.
#pragma once

#include <cstddef>
#include <cstdint>

// A request is handled only when its length field lies in this range.
inline constexpr std::uint32_t kCommandMinLength = 9896;
inline constexpr std::uint32_t kCommandMaxLength = 10920;

// Command codes.
enum CommandCode : std::uint32_t {
  kCommandSafeRemove = 1,
  kCommandReleaseDrive = 2,
  kCommandReleaseDriveAlso = 3,
  kCommandForwardMessage = 6,
  kCommandPause = 7,
  kCommandResume = 8,
  kCommandRefreshGauges = 9,
  kCommandSetStatus = 10,
  kCommandReadStatus = 11,
  kCommandWriteControl = 12,
  kCommandRegistry = 13,
};

// Result and detail of a code outside the table (-777).
inline constexpr std::uint32_t kCommandUnknownResult = 0xFFFFFCF7u;

// Registry request operations; any other value opens and closes the key only.
inline constexpr std::uint32_t kRegistryQuery = 0;
inline constexpr std::uint32_t kRegistrySet = 1;

#pragma pack(push, 4)
// Registry request: 52 fixed bytes followed by the subkey path (UTF-16,
// terminated). The value name starts `nameOffset` bytes after the path's start,
// the data `dataOffset` bytes after the name's start.
struct RegistryRequest {
  std::uint8_t reserved[12];
  std::uint64_t rootKey;         // predefined root key, as its 64-bit handle value
  std::uint64_t nameOffset;      // from the start of the subkey path
  std::uint64_t dataOffset;      // from the start of the value name
  std::uint32_t dataLength;      // in: data area size; out (query): bytes reported
  std::uint32_t dataLengthHigh;  // out: 0 after a query
  std::uint32_t valueType;       // REG_* type: read by a set, written by a query
  std::uint32_t operation;       // kRegistryQuery, kRegistrySet, other
};
#pragma pack(pop)

static_assert(sizeof(RegistryRequest) == 52);
static_assert(offsetof(RegistryRequest, reserved) == 0);
static_assert(offsetof(RegistryRequest, rootKey) == 12);
static_assert(offsetof(RegistryRequest, nameOffset) == 20);
static_assert(offsetof(RegistryRequest, dataOffset) == 28);
static_assert(offsetof(RegistryRequest, dataLength) == 36);
static_assert(offsetof(RegistryRequest, dataLengthHigh) == 40);
static_assert(offsetof(RegistryRequest, valueType) == 44);
static_assert(offsetof(RegistryRequest, operation) == 48);

// Offset of the subkey path inside a registry request.
inline constexpr std::size_t kRegistryPathOffset = sizeof(RegistryRequest);

// Size of one drive record (the drive image) and offset of its firmware serial,
// the key by which commands 11 and 12 name a drive.
inline constexpr std::size_t kDriveImageSize = 7640;
inline constexpr std::size_t kDriveKeyOffsetInImage = 584;
inline constexpr std::size_t kDriveKeyCapacity = 128;  // UTF-16 units

struct CommandMessage {
  std::uint64_t length;  // whole message in bytes
  std::uint32_t command;
  std::uint32_t arg1;
  std::uint32_t arg2;
  std::uint32_t arg3;
  std::uint32_t result;
  std::uint32_t detail;                      // error code, data length or refusal code
  std::uint8_t resultSlot[8];                // command 6's result slot; never written
  std::uint8_t reserved[2140];               // not read or written by the service
  std::uint8_t driveImage[kDriveImageSize];  // a drive record (commands 11, 12)
  std::uint8_t statusBlock[8];               // out: command 11
  std::uint8_t controlBlock[8];              // in: command 12
  RegistryRequest registry;                  // command 13
  std::uint8_t registryText[1032];           // path, name and data of command 13
};

static_assert(sizeof(CommandMessage) == kCommandMaxLength);
static_assert(offsetof(CommandMessage, length) == 0);
static_assert(offsetof(CommandMessage, command) == 8);
static_assert(offsetof(CommandMessage, arg1) == 12);
static_assert(offsetof(CommandMessage, arg2) == 16);
static_assert(offsetof(CommandMessage, arg3) == 20);
static_assert(offsetof(CommandMessage, result) == 24);
static_assert(offsetof(CommandMessage, detail) == 28);
static_assert(offsetof(CommandMessage, resultSlot) == 32);
static_assert(offsetof(CommandMessage, reserved) == 40);
static_assert(offsetof(CommandMessage, driveImage) == 2180);
static_assert(offsetof(CommandMessage, driveImage) + kDriveKeyOffsetInImage == 2764);
static_assert(offsetof(CommandMessage, statusBlock) == 9820);
static_assert(offsetof(CommandMessage, controlBlock) == 9828);
static_assert(offsetof(CommandMessage, registry) == 9836);
static_assert(offsetof(CommandMessage, registryText) == 9836 + kRegistryPathOffset);

inline constexpr std::size_t kRegistryRequestOffset = offsetof(CommandMessage, registry);
