#include "block_reader.h"

#include <cstring>

#include "platform/wide.h"

BlockReader::~BlockReader() {
  if (view_ != nullptr) UnmapViewOfFile(view_);
  if (mutex_ != nullptr) CloseHandle(mutex_);
  if (mapping_ != nullptr) CloseHandle(mapping_);
}

bool BlockReader::Open(bool waitOpen, ULONGLONG deadline, std::string* error) {
  for (;;) {
    mapping_ = OpenFileMappingW(FILE_MAP_READ, FALSE, kFileMapName);
    mutex_ = mapping_ != nullptr ? OpenMutexW(SYNCHRONIZE, FALSE, kStateMutexName) : nullptr;
    if (mutex_ != nullptr) break;
    const DWORD code = GetLastError();
    if (mapping_ != nullptr) CloseHandle(mapping_);
    mapping_ = nullptr;
    if (!waitOpen || GetTickCount64() >= deadline) {
      *error = "cannot open the state block (error " + std::to_string(code) + ")";
      return false;
    }
    Sleep(50);
  }
  // Mapping the whole block succeeds only when the mapping has its full size.
  view_ = MapViewOfFile(mapping_, FILE_MAP_READ, 0, 0, kStateBlockSize);
  if (view_ == nullptr) {
    *error = "cannot map " + std::to_string(kStateBlockSize) + " bytes (error " +
             std::to_string(GetLastError()) + ")";
    return false;
  }
  return true;
}

DWORD BlockReader::PeekSequence() const {
  return *static_cast<const volatile DWORD*>(view_);
}

void BlockReader::Copy(StateBlock* copy) const {
  WaitForSingleObject(mutex_, INFINITE);
  std::memcpy(static_cast<void*>(copy), view_, kStateBlockSize);
  ReleaseMutex(mutex_);
}

std::string FieldText(const WCHAR* text, std::size_t capacity) {
  return WideToUtf8(WideView(text, WideLength(text, capacity)));
}

int Clamp(LONG count, int limit) {
  return count < 0 ? 0 : (count > limit ? limit : static_cast<int>(count));
}

nlohmann::ordered_json DriveJson(const DriveRecord& d, int index) {
  return {{"index", index},
          {"busKind", d.busKind},
          {"diskNumber", d.diskNumber},
          {"channelIndex", d.channelIndex},
          {"extendedIdentity", d.extendedIdentity},
          {"fromChannel", d.fromChannel},
          {"statusCode", d.statusCode},
          {"statusLevel", d.statusLevel},
          {"powerState", d.powerState},
          {"publishedIndex", d.publishedIndex},
          {"gaugePercent", d.gaugePercent},
          {"gaugeSegments", d.gaugeSegments},
          {"volumeLetters", FIELD_TEXT(d, volumeLetters)},
          {"firmwareSerial", FIELD_TEXT(d, firmwareSerial)},
          {"model", FIELD_TEXT(d, model)},
          {"friendlyName", FIELD_TEXT(d, friendlyName)},
          {"serialNumber", FIELD_TEXT(d, serialNumber)}};
}

nlohmann::ordered_json ChannelJson(const ChannelRecord& c, int index) {
  return {{"index", index},
          {"kind", c.kind},
          {"mode", c.mode},
          {"linkedDrive", c.linkedDrive},
          {"gaugePercentSent", c.gaugePercentSent},
          {"driveGoneSent", c.driveGoneSent},
          {"identityText", FIELD_TEXT(c, identityText)},
          {"devicePath", FIELD_TEXT(c, devicePath)}};
}

nlohmann::ordered_json BlockJson(const StateBlock& b) {
  nlohmann::ordered_json out = {
      {"size", kStateBlockSize},          {"sequence", b.sequence},
      {"channelCount", b.channelCount},   {"driveCount", b.driveCount},
      {"countedDrives", b.countedDrives}, {"publishedCount", b.publishedCount},
      {"statusWord", b.statusWord}};
  auto& drives = out["drives"] = nlohmann::ordered_json::array();
  for (int i = 0; i < Clamp(b.driveCount, kMaxDrives); ++i)
    drives.push_back(DriveJson(b.drives[i], i));
  auto& published = out["published"] = nlohmann::ordered_json::array();
  for (int i = 0; i < Clamp(b.publishedCount, kMaxDrives); ++i) {
    published.push_back(DriveJson(b.published[i], i));
  }
  auto& channels = out["channels"] = nlohmann::ordered_json::array();
  for (int i = 0; i < Clamp(b.channelCount, kMaxChannels); ++i) {
    channels.push_back(ChannelJson(b.channels[i], i));
  }
  return out;
}
