#include "platform/posix/handle_table.h"

#include <pthread.h>

#include <cstdint>
#include <mutex>
#include <unordered_map>
#include <utility>

namespace emu {
namespace {

// Values are index * 4; the index runs up to kMaxIndex and then starts again
// at 1, skipping values still open, so a closed value is not reused soon.
constexpr std::uintptr_t kMaxIndex = 0x3FFFFF;

struct Table {
  std::mutex lock;
  std::unordered_map<std::uintptr_t, std::shared_ptr<KernelObject>> objects;
  std::uintptr_t nextIndex = 1;
};

Table* g_table = nullptr;

void ForkPrepare() {
  g_table->lock.lock();
}
void ForkParent() {
  g_table->lock.unlock();
}
// A forked child inherits no handles: the objects belong to the parent (the
// copies are dropped without running their close logic).
void ForkChild() {
  Table* inherited = g_table;
  inherited->lock.unlock();
  g_table = new Table();
  g_table->nextIndex = inherited->nextIndex;
}

// Never destroyed: threads of the emulation may use handles during exit.
Table& GetTable() {
  static Table* table = [] {
    g_table = new Table();
    pthread_atfork(ForkPrepare, ForkParent, ForkChild);
    return g_table;
  }();
  (void)table;
  return *g_table;
}

std::uintptr_t Key(HANDLE handle) {
  return reinterpret_cast<std::uintptr_t>(handle);
}

}  // namespace

HANDLE AllocateHandle(std::shared_ptr<KernelObject> object) {
  Table& table = GetTable();
  std::lock_guard<std::mutex> guard(table.lock);
  for (;;) {
    std::uintptr_t index = table.nextIndex;
    table.nextIndex = index >= kMaxIndex ? 1 : index + 1;
    std::uintptr_t value = index * 4;
    if (table.objects.find(value) == table.objects.end()) {
      table.objects.emplace(value, std::move(object));
      return reinterpret_cast<HANDLE>(value);
    }
  }
}

std::shared_ptr<KernelObject> LookupHandle(HANDLE handle) {
  Table& table = GetTable();
  std::lock_guard<std::mutex> guard(table.lock);
  auto it = table.objects.find(Key(handle));
  if (it == table.objects.end()) return nullptr;
  return it->second;
}

bool ReleaseHandle(HANDLE handle) {
  std::shared_ptr<KernelObject> object;
  {
    Table& table = GetTable();
    std::lock_guard<std::mutex> guard(table.lock);
    auto it = table.objects.find(Key(handle));
    if (it == table.objects.end()) return false;
    object = std::move(it->second);
    table.objects.erase(it);
  }
  object->HandleClosed();
  return true;
}

long HandleCount() {
  Table& table = GetTable();
  std::lock_guard<std::mutex> guard(table.lock);
  return static_cast<long>(table.objects.size());
}

}  // namespace emu
