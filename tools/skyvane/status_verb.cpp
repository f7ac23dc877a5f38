#include "status_verb.h"

#include <cstdio>
#include <cstdlib>
#include <cstring>
#include <memory>
#include <string>

#include "monitor/state_block.h"
#include "platform/wide.h"
#include "platform/win32.h"

namespace {

struct Options {
  bool json = false;
  bool waitOpen = false;  // retry until the service has created the objects
  bool waitForStatus = false;
  DWORD waitStatus = 0;
  DWORD waitSequence = 0;  // wait until sequence reaches this value
  DWORD timeoutMs = 10000;
};

bool ParseOptions(int argc, char** argv, Options* options) {
  for (int i = 2; i < argc; ++i) {
    if (std::strcmp(argv[i], "--json") == 0) {
      options->json = true;
    } else if (std::strcmp(argv[i], "--wait-status") == 0 && i + 1 < argc) {
      options->waitForStatus = true;
      options->waitStatus = static_cast<DWORD>(std::strtoul(argv[++i], nullptr, 0));
    } else if (std::strcmp(argv[i], "--wait-open") == 0) {
      options->waitOpen = true;
    } else if (std::strcmp(argv[i], "--wait-sequence") == 0 && i + 1 < argc) {
      options->waitSequence = static_cast<DWORD>(std::strtoul(argv[++i], nullptr, 0));
    } else if (std::strcmp(argv[i], "--timeout-ms") == 0 && i + 1 < argc) {
      options->timeoutMs = static_cast<DWORD>(std::strtoul(argv[++i], nullptr, 0));
    } else {
      std::fprintf(stderr, "status: unknown option %s\n", argv[i]);
      return false;
    }
  }
  return true;
}

std::string Text(const WCHAR* text, std::size_t capacity) {
  return WideToUtf8(WideView(text, WideLength(text, capacity)));
}

std::string JsonString(const std::string& text) {
  std::string out = "\"";
  for (const char c : text) {
    if (c == '"' || c == '\\') {
      out += '\\';
      out += c;
    } else if (static_cast<unsigned char>(c) < 0x20) {
      char escaped[8];
      std::snprintf(escaped, sizeof(escaped), "\\u%04x", static_cast<unsigned char>(c));
      out += escaped;
    } else {
      out += c;
    }
  }
  return out + "\"";
}

#define FIELD_TEXT(record, field) Text((record).field, sizeof((record).field) / sizeof(WCHAR))

void PrintDriveJson(const DriveRecord& d, int index, bool last) {
  std::printf(
      "    {\"index\": %d, \"busKind\": %u, \"diskNumber\": %u, \"channelIndex\": %d, "
      "\"extendedIdentity\": %u, "
      "\"fromChannel\": %u, \"statusCode\": %u, \"statusLevel\": %d, \"powerState\": %u, "
      "\"publishedIndex\": %d, "
      "\"gaugePercent\": %u, \"volumeLetters\": %s, \"firmwareSerial\": %s, \"model\": %s, "
      "\"friendlyName\": %s, "
      "\"serialNumber\": %s}%s\n",
      index, static_cast<unsigned>(d.busKind), static_cast<unsigned>(d.diskNumber),
      static_cast<int>(d.channelIndex), static_cast<unsigned>(d.extendedIdentity),
      static_cast<unsigned>(d.fromChannel), static_cast<unsigned>(d.statusCode),
      static_cast<int>(d.statusLevel), static_cast<unsigned>(d.powerState),
      static_cast<int>(d.publishedIndex), static_cast<unsigned>(d.gaugePercent),
      JsonString(FIELD_TEXT(d, volumeLetters)).c_str(),
      JsonString(FIELD_TEXT(d, firmwareSerial)).c_str(), JsonString(FIELD_TEXT(d, model)).c_str(),
      JsonString(FIELD_TEXT(d, friendlyName)).c_str(),
      JsonString(FIELD_TEXT(d, serialNumber)).c_str(), last ? "" : ",");
}

int Clamp(LONG count, int limit) {
  return count < 0 ? 0 : (count > limit ? limit : static_cast<int>(count));
}

void PrintJson(const StateBlock& b) {
  std::printf(
      "{\n  \"size\": %u,\n  \"sequence\": %u,\n  \"channelCount\": %d,\n  \"driveCount\": %d,\n",
      static_cast<unsigned>(kStateBlockSize), static_cast<unsigned>(b.sequence),
      static_cast<int>(b.channelCount), static_cast<int>(b.driveCount));
  std::printf("  \"countedDrives\": %d,\n  \"publishedCount\": %d,\n  \"statusWord\": %u,\n",
              static_cast<int>(b.countedDrives), static_cast<int>(b.publishedCount),
              static_cast<unsigned>(b.statusWord));
  std::printf("  \"drives\": [\n");
  const int drives = Clamp(b.driveCount, kMaxDrives);
  for (int i = 0; i < drives; ++i) PrintDriveJson(b.drives[i], i, i + 1 == drives);
  std::printf("  ],\n  \"published\": [\n");
  const int published = Clamp(b.publishedCount, kMaxDrives);
  for (int i = 0; i < published; ++i) PrintDriveJson(b.published[i], i, i + 1 == published);
  std::printf("  ],\n  \"channels\": [\n");
  const int channels = Clamp(b.channelCount, kMaxChannels);
  for (int i = 0; i < channels; ++i) {
    const ChannelRecord& c = b.channels[i];
    std::printf(
        "    {\"index\": %d, \"kind\": %u, \"mode\": %u, \"linkedDrive\": %d, "
        "\"gaugePercentSent\": %u, "
        "\"driveGoneSent\": %u, \"identityText\": %s, \"devicePath\": %s}%s\n",
        i, static_cast<unsigned>(c.kind), static_cast<unsigned>(c.mode),
        static_cast<int>(c.linkedDrive), static_cast<unsigned>(c.gaugePercentSent),
        static_cast<unsigned>(c.driveGoneSent), JsonString(FIELD_TEXT(c, identityText)).c_str(),
        JsonString(FIELD_TEXT(c, devicePath)).c_str(), i + 1 == channels ? "" : ",");
  }
  std::printf("  ]\n}\n");
}

void PrintTable(const StateBlock& b) {
  std::printf("sequence       %u\nstatusWord     %u\nchannelCount   %d\ndriveCount     %d\n",
              static_cast<unsigned>(b.sequence), static_cast<unsigned>(b.statusWord),
              static_cast<int>(b.channelCount), static_cast<int>(b.driveCount));
  std::printf("countedDrives  %d\npublishedCount %d\n", static_cast<int>(b.countedDrives),
              static_cast<int>(b.publishedCount));
  const int drives = Clamp(b.driveCount, kMaxDrives);
  std::printf("\nDrives (%d)\n  %-3s %-4s %-6s %-8s %-6s %-5s %-18s %s\n", drives, "#", "bus",
              "status", "letters", "chan", "pub", "serial", "model");
  for (int i = 0; i < drives; ++i) {
    const DriveRecord& d = b.drives[i];
    std::printf("  %-3d %-4u %-6u %-8s %-6d %-5d %-18s %s\n", i, static_cast<unsigned>(d.busKind),
                static_cast<unsigned>(d.statusCode), FIELD_TEXT(d, volumeLetters).c_str(),
                static_cast<int>(d.channelIndex), static_cast<int>(d.publishedIndex),
                FIELD_TEXT(d, firmwareSerial).c_str(), FIELD_TEXT(d, model).c_str());
  }
  const int channels = Clamp(b.channelCount, kMaxChannels);
  std::printf("\nChannels (%d)\n  %-3s %-4s %-4s %-6s %-6s %s\n", channels, "#", "kind", "mode",
              "drive", "gauge", "device path");
  for (int i = 0; i < channels; ++i) {
    const ChannelRecord& c = b.channels[i];
    std::printf("  %-3d %-4u %-4u %-6d %-6u %s\n", i, static_cast<unsigned>(c.kind),
                static_cast<unsigned>(c.mode), static_cast<int>(c.linkedDrive),
                static_cast<unsigned>(c.gaugePercentSent), FIELD_TEXT(c, devicePath).c_str());
  }
}

// Copies the mapped block under the mutex, as the application does.
void CopyBlock(HANDLE mutex, const void* view, StateBlock* copy) {
  WaitForSingleObject(mutex, INFINITE);
  std::memcpy(copy, view, kStateBlockSize);
  ReleaseMutex(mutex);
}

// Opens the mapping and the mutex by name, as the application does; with
// waitOpen, retries until the deadline.
bool OpenObjects(const Options& options, ULONGLONG deadline, HANDLE* mapping, HANDLE* mutex) {
  for (;;) {
    *mapping = OpenFileMappingW(FILE_MAP_READ, FALSE, kFileMapName);
    *mutex = *mapping != nullptr ? OpenMutexW(SYNCHRONIZE, FALSE, kStateMutexName) : nullptr;
    if (*mutex != nullptr) return true;
    const DWORD error = GetLastError();
    if (*mapping != nullptr) CloseHandle(*mapping);
    *mapping = nullptr;
    if (!options.waitOpen || GetTickCount64() >= deadline) {
      std::fprintf(stderr, "status: cannot open the state block (error %u)\n",
                   static_cast<unsigned>(error));
      return false;
    }
    Sleep(50);
  }
}

}  // namespace

int RunStatusVerb(int argc, char** argv) {
  Options options;
  if (!ParseOptions(argc, argv, &options)) return 2;
  const ULONGLONG deadline = GetTickCount64() + options.timeoutMs;
  HANDLE mapping = nullptr;
  HANDLE mutex = nullptr;
  if (!OpenObjects(options, deadline, &mapping, &mutex)) return 1;
  // Mapping the whole block succeeds only when the mapping has its full size.
  const void* view = MapViewOfFile(mapping, FILE_MAP_READ, 0, 0, kStateBlockSize);
  if (view == nullptr) {
    std::fprintf(stderr, "status: cannot map %u bytes (error %u)\n",
                 static_cast<unsigned>(kStateBlockSize), static_cast<unsigned>(GetLastError()));
    CloseHandle(mutex);
    CloseHandle(mapping);
    return 1;
  }
  auto block = std::make_unique<StateBlock>();
  CopyBlock(mutex, view, block.get());
  int result = 0;
  if (options.waitForStatus || options.waitSequence != 0) {
    // The mapping stays open while waiting, so the block outlives the service.
    std::fprintf(stderr, "status: holding the state block\n");
    std::fflush(stderr);
    while ((options.waitForStatus && block->statusWord != options.waitStatus) ||
           block->sequence < options.waitSequence) {
      if (GetTickCount64() >= deadline) {
        std::fprintf(stderr, "status: timed out at statusWord %u, sequence %u\n",
                     static_cast<unsigned>(block->statusWord),
                     static_cast<unsigned>(block->sequence));
        result = 3;
        break;
      }
      Sleep(20);
      CopyBlock(mutex, view, block.get());
    }
  }
  if (options.json) {
    PrintJson(*block);
  } else {
    PrintTable(*block);
  }
  std::fflush(stdout);
  UnmapViewOfFile(view);
  CloseHandle(mutex);
  CloseHandle(mapping);
  return result;
}
