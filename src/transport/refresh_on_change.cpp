#include "transport/refresh_on_change.h"

#include <cstring>

#include "monitor/monitor_state.h"
#include "platform/wide.h"
#include "service/process_locks.h"

namespace {

// Holds a critical section for one scope.
constexpr std::size_t kKeyUnits = 256;
constexpr std::size_t kRemembered = 64;

struct Entry {
  WCHAR key[kKeyUnits];
  DWORD conditions;
};

struct Table {
  CRITICAL_SECTION lock;
  const StateBlock* block = nullptr;
  Entry entries[kRemembered] = {};
  std::size_t nextEvicted = 0;
};

Table& Conditions() {
  static Table* table = [] {
    auto* made = new Table();
    InitializeCriticalSection(&made->lock);
    return made;
  }();
  return *table;
}

// The text that tells this drive apart from the others.
const WCHAR* KeyOf(const DriveRecord* drive) {
  if (drive->diskPath[0] != 0) return drive->diskPath;
  if (drive->channelPath[0] != 0) return drive->channelPath;
  if (drive->hidPath[0] != 0) return drive->hidPath;
  if (drive->controlPath[0] != 0) return drive->controlPath;
  if (drive->firmwareSerial[0] != 0) return drive->firmwareSerial;
  return drive->serialNumber;
}

void Reset(Table& table) {
  std::memset(table.entries, 0, sizeof(table.entries));
  table.nextEvicted = 0;
}

// The entry of the key; a free or evicted one when `create`, else null.
Entry* Find(Table& table, const WCHAR* key, bool create) {
  Entry* free = nullptr;
  for (Entry& entry : table.entries) {
    if (entry.conditions != 0 && WideEqual(entry.key, key)) return &entry;
    if (free == nullptr && entry.conditions == 0) free = &entry;
  }
  if (!create) return nullptr;
  if (free == nullptr) {
    free = &table.entries[table.nextEvicted];
    table.nextEvicted = (table.nextEvicted + 1) % kRemembered;
  }
  std::memset(free, 0, sizeof(*free));
  WideCopy(free->key, kKeyUnits, key);
  return free;
}

}  // namespace

void NoteRefreshConditions(const DriveRecord* drive, DWORD conditions, bool hold) {
  if (drive == nullptr || conditions == 0) return;
  WCHAR key[kKeyUnits] = {};
  WideCopy(key, kKeyUnits, KeyOf(drive));
  bool ask = false;
  {
    Table& table = Conditions();
    SectionLock guard(&table.lock);
    if (table.block != monitorState.stateBlock) {
      Reset(table);
      table.block = monitorState.stateBlock;
    }
    Entry* entry = Find(table, key, hold);
    if (entry != nullptr) {
      ask = hold && (entry->conditions & conditions) != conditions;
      entry->conditions = hold ? entry->conditions | conditions : entry->conditions & ~conditions;
    }
  }
  if (ask) RequestRefresh();
}

void ForgetRefreshConditions() {
  Table& table = Conditions();
  SectionLock guard(&table.lock);
  Reset(table);
}
