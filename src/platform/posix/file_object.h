// Handles that carry I/O (devices and named-pipe ends) and the overlapped
// bookkeeping they share: the request status kept in OVERLAPPED::Internal as
// an NTSTATUS, the byte count in InternalHigh, and the event signalled at
// completion.
#pragma once

#include <cstdint>
#include <memory>

#include "platform/posix/handle_table.h"
#include "platform/posix/kernel.h"
#include "platform/posix/slot_object.h"

namespace emu {

class FileObject : public KernelObject {
 public:
  explicit FileObject(bool overlapped) : overlapped_(overlapped) {}
  // Opened with FILE_FLAG_OVERLAPPED: requests that cannot finish at once
  // return ERROR_IO_PENDING; otherwise the caller waits.
  bool Overlapped() const { return overlapped_; }

  // Each follows the Win32 call of the same purpose (return value, last
  // error, output count, OVERLAPPED status and event).
  virtual BOOL Read(void* buffer, DWORD length, DWORD* done, OVERLAPPED* overlapped) = 0;
  virtual BOOL Write(const void* buffer, DWORD length, DWORD* done, OVERLAPPED* overlapped) = 0;
  virtual BOOL Control(DWORD code, void* input, DWORD inputLength, void* output, DWORD outputLength,
                       DWORD* done, OVERLAPPED* overlapped) = 0;
  // Cancels pending requests of thread `threadId` (0: of every thread), or
  // only the one using `overlapped` when it is not null. Returns how many
  // were asked to cancel.
  virtual int Cancel(std::int32_t threadId, OVERLAPPED* overlapped) = 0;
  virtual BOOL Flush() { return TRUE; }

 private:
  bool overlapped_;
};

// NTSTATUS kept in OVERLAPPED::Internal for a Win32 error, and back.
ULONG_PTR StatusFromError(DWORD error);
DWORD ErrorFromStatus(ULONG_PTR status);
// Errors that still carry data (the request counts as completed with a
// warning: its status and count are stored and its event is signalled).
inline bool IsWarning(DWORD error) {
  return error == ERROR_MORE_DATA;
}

// The event of `overlapped` (null when it has none); false with
// ERROR_INVALID_HANDLE when hEvent is not an event handle.
bool ResolveEvent(const OVERLAPPED* overlapped, std::shared_ptr<SlotObject>* event);

// Marks `overlapped` as pending (STATUS_PENDING, count 0) and clears its
// event, as the system does when a request starts.
void StartOverlapped(OVERLAPPED* overlapped, const std::shared_ptr<SlotObject>& event);
// Stores the result in `overlapped` and wakes GetOverlappedResult waiters.
// Must not be called with the kernel lock held.
void StoreOverlapped(OVERLAPPED* overlapped, DWORD error, DWORD bytes);
// The same, for callers that hold the kernel lock; also signals `event`.
void StoreOverlappedLocked(OVERLAPPED* overlapped, const std::shared_ptr<SlotObject>& event,
                           DWORD error, DWORD bytes);
// Signals `event` (may be null). Takes the kernel lock.
void SignalEvent(const std::shared_ptr<SlotObject>& event);
void SignalEventLocked(const std::shared_ptr<SlotObject>& event);

// Reports a request that finished at once on an overlapped handle: the
// status, count and event are set for success and warnings (not for
// failures), and the Win32 return value and last error are produced.
BOOL FinishAtOnce(OVERLAPPED* overlapped, const std::shared_ptr<SlotObject>& event, DWORD error,
                  DWORD bytes, DWORD* done);

}  // namespace emu
