// Reads the service's shared state block as the user-interface application
// does: the mapping and the mutex opened by name, the block copied whole under
// the mutex. Shared by `status` and `watch`.
#pragma once

#include <memory>
#include <nlohmann/json.hpp>
#include <string>

#include "monitor/state_block.h"
#include "platform/win32.h"

class BlockReader {
 public:
  BlockReader() = default;
  ~BlockReader();
  BlockReader(const BlockReader&) = delete;
  BlockReader& operator=(const BlockReader&) = delete;

  // Opens and maps the block; with waitOpen, retries until `deadline`
  // (GetTickCount64). False with *error (a one-line reason) otherwise.
  bool Open(bool waitOpen, ULONGLONG deadline, std::string* error);
  // The sequence word as the last publish left it (read without the mutex:
  // a cheap look to tell whether a copy is worth taking).
  DWORD PeekSequence() const;
  // Copies the whole block under the mutex.
  void Copy(StateBlock* copy) const;

 private:
  HANDLE mapping_ = nullptr;
  HANDLE mutex_ = nullptr;
  const void* view_ = nullptr;
};

// Text of a fixed-capacity wide field.
std::string FieldText(const WCHAR* text, std::size_t capacity);
#define FIELD_TEXT(record, field) FieldText((record).field, sizeof((record).field) / sizeof(WCHAR))

// Records in use, clamped to the array's capacity.
int Clamp(LONG count, int limit);

nlohmann::ordered_json DriveJson(const DriveRecord& d, int index);
nlohmann::ordered_json ChannelJson(const ChannelRecord& c, int index);
// The block's header, drives, published drives and channels.
nlohmann::ordered_json BlockJson(const StateBlock& b);
