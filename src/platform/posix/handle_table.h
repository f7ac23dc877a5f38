// The emulation's per-process handle table: every HANDLE it gives out is a
// checked value that maps to a KernelObject. Closed or unknown values are
// rejected (ERROR_INVALID_HANDLE at the API), and the table's size is what
// platform::LiveHandleCount() reports.
//
// Other parts of the emulation (registry keys, service manager handles,
// device information lists, ...) derive their own object type from
// KernelObject and use AllocateHandle / LookupHandleAs / ReleaseHandle.
#pragma once

#include <memory>

#include "platform/posix/win32_base.h"

namespace emu {

class KernelObject {
 public:
  KernelObject() = default;
  KernelObject(const KernelObject&) = delete;
  KernelObject& operator=(const KernelObject&) = delete;
  virtual ~KernelObject() = default;

  // Whether CloseHandle may close a handle to this object. Objects with their
  // own close call (registry keys, service handles, device lists) return false,
  // so CloseHandle on them fails with ERROR_INVALID_HANDLE as on Windows.
  virtual bool ClosableByCloseHandle() const { return true; }
  // Called once when a handle to this object is released (before the table
  // drops its reference), outside the table's lock. The object itself lives
  // on while other shared references exist.
  virtual void HandleClosed() {}
};

// Enters `object` into the table and returns its new handle: a small multiple
// of 4, never null, never a pseudo handle, not reused until many others have
// been given out.
HANDLE AllocateHandle(std::shared_ptr<KernelObject> object);

// The object behind `handle`, or null when the handle is not open.
std::shared_ptr<KernelObject> LookupHandle(HANDLE handle);

// The object behind `handle` if it is open and of type T, else null.
template <class T>
std::shared_ptr<T> LookupHandleAs(HANDLE handle) {
  return std::dynamic_pointer_cast<T>(LookupHandle(handle));
}

// Removes `handle` from the table (calling HandleClosed on its object); false
// when it was not open. Does not set the last error.
bool ReleaseHandle(HANDLE handle);

// Handles open in this process.
long HandleCount();

}  // namespace emu
