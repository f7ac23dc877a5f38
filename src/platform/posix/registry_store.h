// The registry store behind the emulation's Reg* calls and service database:
// keys with typed values, kept in one file shared by every process of the
// user and re-read and rewritten under a file lock on every operation, so
// processes see each other's writes at once.
#pragma once

#include <cstdint>
#include <functional>
#include <map>
#include <string>
#include <string_view>
#include <vector>

#include "platform/posix/win32_registry.h"

namespace emu::registry {

using Text = std::u16string;
using TextView = std::u16string_view;

struct Value {
  Text name;  // empty for the key's default value
  DWORD type = REG_NONE;
  std::vector<BYTE> data;
};

struct Key {
  Text path;                  // full path as created, e.g. "HKEY_LOCAL_MACHINE\SYSTEM"
  bool readOnly = false;      // no write access for anyone (test hook)
  std::vector<Value> values;  // in creation order, as Windows enumerates them
};

// All keys by folded path (ASCII lower case). The five roots always exist.
struct Store {
  std::map<Text, Key> keys;

  Key* Find(TextView path);
  Value* FindValue(Key& key, TextView name);
  // Creates `path` and every missing key above it; returns the key.
  Key& Create(TextView path);
  // True when `path` has at least one sub-key.
  bool HasSubKeys(TextView path) const;
  // Names (last component, as created) of the direct sub-keys, sorted
  // case-insensitively.
  std::vector<Text> SubKeyNames(TextView path) const;
  // Removes `path` and everything below it.
  void EraseTree(TextView path);
};

// ASCII case folding, as registry names compare.
Text Fold(TextView text);
bool EqualNoCase(TextView a, TextView b);

// Name of a predefined root ("HKEY_LOCAL_MACHINE"...), or empty when `key`
// is not one of the five supported roots.
TextView RootName(HKEY key);

// Joins a key path and a sub-key path given by a caller: backslash-separated,
// empty components and a trailing backslash ignored. Fails (returns false)
// for a leading backslash, as Windows does (ERROR_BAD_PATHNAME).
bool JoinPath(TextView base, const WCHAR* subKey, Text& out);

// Runs `operation` on the current store with the file locked. When it
// returns true the store is written back before the lock is released.
// Returns ERROR_SUCCESS, or the error if the store could not be locked or
// written (the operation's own result travels through its captures).
DWORD Transact(const std::function<bool(Store&)>& operation);

// Where the store lives (SKYVANE_REGISTRY or the per-user default).
std::string StorePath();

// File format, for the tests of the parser.
std::string Serialize(const Store& store);
// False (and an empty store with its roots) when the text is not a complete,
// well-formed store.
bool Parse(std::string_view text, Store& store);

}  // namespace emu::registry
