// Named pipes. Each instance lives in the shared kernel region with one
// message queue per direction; every process keeps the list of its own
// requests that wait for the other end (a read with no data, a write that
// does not fit, a connect with no client yet). A request is retried, in
// issue order, whenever its instance changes, by the thread that waits for
// it (synchronous handles) or by this process's I/O service thread
// (overlapped requests), which copies the data, stores the OVERLAPPED status
// and signals the event. All of it is guarded by the kernel lock; every
// change of an instance notifies its key, and a change of what listens
// notifies the pipe-names key (WaitNamedPipeW). The processes at the other
// ends are watched, so an end whose process died is closed on its behalf.
#include "platform/posix/pipes.h"

#include <pthread.h>

#include <cstring>
#include <list>
#include <memory>
#include <vector>

#include "platform/posix/file_object.h"
#include "platform/posix/kernel.h"
#include "platform/win32.h"

namespace emu {

using kernel::PipeInstance;
using kernel::PipeQueue;

namespace {

constexpr std::uint32_t kCapacity = kernel::kPipeQueueBytes;
constexpr std::uint32_t kHeader = 4;

// ---- Message queue (a ring of [u32 length][bytes] records) -------------------

// A queue's bookkeeping and its storage.
struct Ring {
  PipeQueue* q;
  std::uint8_t* data;
};

void QueueClear(PipeQueue& q) {
  kernel::Touch(q);
  q.readPos = 0;
  q.usedBytes = 0;
  q.messages = 0;
  q.headConsumed = 0;
}

void RingRead(const Ring& r, std::uint32_t offset, void* out, std::uint32_t n) {
  std::uint32_t pos = (r.q->readPos + offset) % kCapacity;
  std::uint32_t first = n < kCapacity - pos ? n : kCapacity - pos;
  std::memcpy(out, r.data + pos, first);
  std::memcpy(static_cast<std::uint8_t*>(out) + first, r.data, n - first);
}

void RingWrite(const Ring& r, std::uint32_t offset, const void* in, std::uint32_t n) {
  std::uint32_t pos = (r.q->readPos + offset) % kCapacity;
  std::uint32_t first = n < kCapacity - pos ? n : kCapacity - pos;
  std::memcpy(r.data + pos, in, first);
  std::memcpy(r.data, static_cast<const std::uint8_t*>(in) + first, n - first);
}

std::uint32_t HeadLength(const Ring& r) {
  std::uint32_t length = 0;
  RingRead(r, 0, &length, kHeader);
  return length;
}

bool QueueFits(const Ring& r, DWORD length) {
  return static_cast<std::uint64_t>(r.q->usedBytes) + kHeader + length <= kCapacity;
}

// The ring bytes a push will write. They lie past the queue's data, so they
// need saving only when this lock hold has already changed the queue: a
// message read in it may have freed them, and a rollback brings it back.
void SaveRingBytes(const Ring& r, std::uint32_t offset, std::uint32_t n) {
  if (!kernel::Journalled(r.q)) return;
  std::uint32_t pos = (r.q->readPos + offset) % kCapacity;
  std::uint32_t first = n < kCapacity - pos ? n : kCapacity - pos;
  kernel::Save(r.data + pos, first);
  if (n > first) kernel::Save(r.data, n - first);
}

void QueuePush(const Ring& r, const void* data, std::uint32_t length) {
  SaveRingBytes(r, r.q->usedBytes, kHeader + length);
  kernel::Touch(*r.q);
  RingWrite(r, r.q->usedBytes, &length, kHeader);
  if (length != 0) RingWrite(r, r.q->usedBytes + kHeader, data, length);
  r.q->usedBytes += kHeader + length;
  kernel::CrashPoint("pipe-push");  // half changed: the count is not yet raised
  ++r.q->messages;
}

void QueuePop(const Ring& r) {
  std::uint32_t length = HeadLength(r);
  r.q->readPos = (r.q->readPos + kHeader + length) % kCapacity;
  r.q->usedBytes -= kHeader + length;
  --r.q->messages;
  r.q->headConsumed = 0;
}

// Bytes not yet read, and those left of the first message.
void QueueAvailable(const Ring& r, DWORD* total, DWORD* leftInMessage) {
  DWORD sum = 0;
  std::uint32_t offset = 0;
  for (std::uint32_t i = 0; i < r.q->messages; ++i) {
    std::uint32_t length = 0;
    RingRead(r, offset, &length, kHeader);
    sum += length;
    offset += kHeader + length;
  }
  sum -= r.q->headConsumed;
  if (total != nullptr) *total = sum;
  if (leftInMessage != nullptr) {
    *leftInMessage = r.q->messages != 0 ? HeadLength(r) - r.q->headConsumed : 0;
  }
}

// Copies up to `length` bytes of the first message (message mode), or of
// as many messages as fit (byte mode). ERROR_MORE_DATA when a message was
// cut; the rest stays first in the queue. `consume` false only looks.
DWORD QueueRead(const Ring& ring, bool messageMode, void* buffer, DWORD length, DWORD* bytes,
                bool consume) {
  auto* out = static_cast<std::uint8_t*>(buffer);
  if (consume) kernel::Touch(*ring.q);
  PipeQueue copy = *ring.q;
  Ring r{consume ? ring.q : &copy, ring.data};
  *bytes = 0;
  if (messageMode) {
    std::uint32_t left = HeadLength(r) - r.q->headConsumed;
    std::uint32_t n = left < length ? left : length;
    if (n != 0) RingRead(r, kHeader + r.q->headConsumed, out, n);
    *bytes = n;
    if (n < left) {
      r.q->headConsumed += n;
      return ERROR_MORE_DATA;
    }
    QueuePop(r);
    return ERROR_SUCCESS;
  }
  while (r.q->messages != 0 && *bytes < length) {
    std::uint32_t left = HeadLength(r) - r.q->headConsumed;
    if (left == 0) {
      // An empty message is read as a read of zero bytes of its own.
      if (*bytes != 0) break;
      QueuePop(r);
      return ERROR_SUCCESS;
    }
    std::uint32_t n = left < length - *bytes ? left : length - *bytes;
    RingRead(r, kHeader + r.q->headConsumed, out + *bytes, n);
    *bytes += n;
    if (n < left) {
      r.q->headConsumed += n;
    } else {
      QueuePop(r);
    }
  }
  return ERROR_SUCCESS;
}

// ---- Names -----------------------------------------------------------------

bool LowerName(const WCHAR* name, WCHAR* out) {
  for (std::uint32_t i = 0; i < kernel::kNameCapacity; ++i) {
    WCHAR c = name[i];
    out[i] = c >= u'A' && c <= u'Z' ? static_cast<WCHAR>(c - u'A' + u'a') : c;
    if (c == 0) return i != 0;
  }
  return false;
}

bool NameEqual(const WCHAR* a, const WCHAR* b) {
  for (std::uint32_t i = 0; i < kernel::kNameCapacity; ++i) {
    if (a[i] != b[i]) return false;
    if (a[i] == 0) return true;
  }
  return true;
}

// ---- Instances ---------------------------------------------------------------

std::uint32_t IndexOf(const PipeInstance& inst) {
  return static_cast<std::uint32_t>(&inst - kernel::GetRegion().pipes);
}

// Wakes the waiters of `inst`, and WaitNamedPipeW callers.
void Changed(const PipeInstance& inst) {
  kernel::Notify(kernel::PipeKey(IndexOf(inst)));
  kernel::Notify(kernel::kPipeNamesKey);
}

void MaybeFree(PipeInstance& inst) {
  if (inst.serverOpen != 0 || inst.clientOpen != 0) return;
  kernel::Touch(inst);
  std::uint32_t next = inst.generation + 1;
  inst.inUse = 0;
  inst.name[0] = 0;
  QueueClear(inst.toClient);
  QueueClear(inst.toServer);
  inst.state = 0;
  inst.generation = next;
}

void CloseServerEnd(PipeInstance& inst) {
  kernel::Touch(inst);
  inst.serverOpen = 0;
  QueueClear(inst.toServer);
}

void CloseClientEnd(PipeInstance& inst) {
  kernel::Touch(inst);
  inst.clientOpen = 0;
  if (inst.state == kernel::kPipeConnected) inst.state = kernel::kPipeClosing;
  QueueClear(inst.toClient);
}

// Ends held by processes that died are closed on their behalf. Asking
// starts watching the other processes, so a later death closes their ends
// without anyone having to look.
void RefreshPeers(PipeInstance& inst) {
  if (inst.inUse == 0) return;
  bool changed = false;
  if (inst.serverOpen != 0 && !kernel::ProcessAlive(inst.server)) {
    CloseServerEnd(inst);
    changed = true;
  }
  if (inst.clientOpen != 0 && !kernel::ProcessAlive(inst.client)) {
    CloseClientEnd(inst);
    changed = true;
  }
  if (changed) {
    Changed(inst);
    MaybeFree(inst);
  }
}

}  // namespace

class PipeEnd;

namespace {

struct PipeOp {
  enum Kind { kRead, kWrite, kConnect } kind = kRead;
  std::shared_ptr<PipeEnd> end;
  OVERLAPPED* overlapped = nullptr;
  std::shared_ptr<SlotObject> event;
  void* readBuffer = nullptr;
  const void* writeBuffer = nullptr;
  DWORD length = 0;
  std::int32_t thread = 0;
  std::uint32_t connection = 0;
  bool synchronous = false;
  bool cancelled = false;
  // Result, for synchronous requests.
  bool finished = false;
  DWORD error = ERROR_SUCCESS;
  DWORD bytes = 0;
};

using OpList = std::list<std::shared_ptr<PipeOp>>;

// Per-process state, guarded by the kernel lock; never destroyed (the I/O
// service thread runs until the process ends).
struct Process {
  OpList ops;
  bool serviceRunning = false;
};

Process* g_process = nullptr;

void ForkChild() {
  // The child has no requests and no service thread of its own.
  g_process = new Process();
}

Process& GetProcess() {
  static Process* process = [] {
    g_process = new Process();
    pthread_atfork(nullptr, nullptr, ForkChild);
    return g_process;
  }();
  (void)process;
  return *g_process;
}

}  // namespace

class PipeEnd : public FileObject, public std::enable_shared_from_this<PipeEnd> {
 public:
  PipeEnd(bool server, std::uint32_t index, std::uint32_t generation, std::uint32_t connection,
          bool overlapped, bool messageRead, bool canRead, bool canWrite, bool canSetState)
      : FileObject(overlapped),
        server_(server),
        index_(index),
        generation_(generation),
        connection_(connection),
        messageRead_(messageRead),
        canRead_(canRead),
        canWrite_(canWrite),
        canSetState_(canSetState) {}

  std::uint32_t Index() const { return index_; }

  // The instance, while this end still refers to it (kernel lock held).
  PipeInstance* Instance() const {
    PipeInstance& inst = kernel::GetRegion().pipes[index_];
    if (inst.inUse == 0 || inst.generation != generation_) return nullptr;
    return &inst;
  }

  BOOL Read(void* buffer, DWORD length, DWORD* done, OVERLAPPED* overlapped) override {
    if (!canRead_) {
      SetLastError(ERROR_ACCESS_DENIED);
      return FALSE;
    }
    return Issue(PipeOp::kRead, buffer, nullptr, length, done, overlapped, false);
  }

  BOOL Write(const void* buffer, DWORD length, DWORD* done, OVERLAPPED* overlapped) override {
    if (!canWrite_) {
      SetLastError(ERROR_ACCESS_DENIED);
      return FALSE;
    }
    return Issue(PipeOp::kWrite, nullptr, buffer, length, done, overlapped, false);
  }

  BOOL Control(DWORD, void*, DWORD, void*, DWORD, DWORD*, OVERLAPPED*) override {
    SetLastError(ERROR_INVALID_FUNCTION);
    return FALSE;
  }

  BOOL Connect(OVERLAPPED* overlapped) {
    if (!server_) {
      SetLastError(ERROR_INVALID_FUNCTION);
      return FALSE;
    }
    return Issue(PipeOp::kConnect, nullptr, nullptr, 0, nullptr, overlapped, false);
  }

  BOOL Transact(void* input, DWORD inputLength, void* output, DWORD outputLength, DWORD* done,
                OVERLAPPED* overlapped) {
    bool messageRead;
    {
      kernel::Lock lock;
      messageRead = messageRead_;
    }
    if (!messageRead) {
      SetLastError(ERROR_BAD_PIPE);
      return FALSE;
    }
    if (!Issue(PipeOp::kWrite, nullptr, input, inputLength, nullptr, nullptr, true)) return FALSE;
    return Issue(PipeOp::kRead, output, nullptr, outputLength, done, overlapped, false);
  }

  int Cancel(std::int32_t threadId, OVERLAPPED* overlapped) override;
  BOOL Flush() override;
  void HandleClosed() override;

  BOOL Disconnect();
  BOOL SetState(const DWORD* mode, const DWORD* maxCollection, const DWORD* collectTimeout);
  BOOL Peek(void* buffer, DWORD size, DWORD* bytesRead, DWORD* total, DWORD* left);

  // Tries to finish `op` (kernel lock held); true when it has a result.
  bool Attempt(PipeOp& op, DWORD* error, DWORD* bytes);

 private:
  BOOL Issue(PipeOp::Kind kind, void* readBuffer, const void* writeBuffer, DWORD length,
             DWORD* done, OVERLAPPED* overlapped, bool forceSynchronous);
  // The direction this end reads from and writes to.
  Ring Incoming(PipeInstance& inst) const { return RingOf(inst, !server_); }
  Ring Outgoing(PipeInstance& inst) const { return RingOf(inst, server_); }
  static Ring RingOf(PipeInstance& inst, bool toClient) {
    kernel::Region& region = kernel::GetRegion();
    auto index = static_cast<std::size_t>(&inst - region.pipes);
    return toClient ? Ring{&inst.toClient, region.pipeData[index][0]}
                    : Ring{&inst.toServer, region.pipeData[index][1]};
  }
  // ERROR_SUCCESS when this end is connected for `connection`, else the
  // error a read (or a write) gets.
  DWORD Link(const PipeInstance& inst, std::uint32_t connection, bool write) const;

  const bool server_;
  const std::uint32_t index_;
  const std::uint32_t generation_;
  const std::uint32_t connection_;  // client: the connection it belongs to
  bool messageRead_;                // guarded by the kernel lock
  const bool canRead_;
  const bool canWrite_;
  const bool canSetState_;
  bool closed_ = false;  // guarded by the kernel lock
};

namespace {

std::uint32_t ProcessKey() {
  return kernel::kProcessKeyBase + static_cast<std::uint32_t>(kernel::Self().pid);
}

// Runs every waiting request of this process that can now finish, in issue
// order (a read or write waits behind an earlier one of the same end).
void ProgressAll() {
  Process& process = GetProcess();
  std::vector<std::pair<const PipeEnd*, PipeOp::Kind>> blocked;
  for (auto it = process.ops.begin(); it != process.ops.end();) {
    PipeOp& op = **it;
    std::pair<const PipeEnd*, PipeOp::Kind> key{op.end.get(), op.kind};
    bool behind = false;
    for (const auto& b : blocked) behind = behind || b == key;
    DWORD error = ERROR_SUCCESS;
    DWORD bytes = 0;
    if (behind || !op.end->Attempt(op, &error, &bytes)) {
      if (!behind) blocked.push_back(key);
      ++it;
      continue;
    }
    if (op.synchronous) {
      op.finished = true;
      op.error = error;
      op.bytes = bytes;
    } else {
      StoreOverlappedLocked(op.overlapped, op.event, error, bytes);
    }
    // The request's own thread, and a request queued behind this one.
    kernel::Notify(kernel::PipeKey(op.end->Index()));
    it = process.ops.erase(it);
  }
}

// The keys a wait sleeps on: the instance of `end`, or for the service
// thread (`end` null) its own key, which a new overlapped request notifies,
// and the instances of this process's overlapped requests. The processes at
// the other ends are looked at first, which also starts watching them.
std::uint32_t KeysToWaitOn(const PipeEnd* end, std::uint32_t* keys) {
  kernel::Region& region = kernel::GetRegion();
  if (end != nullptr) {
    RefreshPeers(region.pipes[end->Index()]);
    keys[0] = kernel::PipeKey(end->Index());
    return 1;
  }
  std::uint32_t count = 0;
  keys[count++] = ProcessKey();
  for (const auto& op : GetProcess().ops) {
    if (op->synchronous) continue;
    std::uint32_t key = kernel::PipeKey(op->end->Index());
    bool known = false;
    for (std::uint32_t k = 0; k < count; ++k) known = known || keys[k] == key;
    if (known) continue;
    RefreshPeers(region.pipes[op->end->Index()]);
    if (count < kernel::kMaxWaitKeys) keys[count++] = key;
  }
  return count;
}

// Progresses requests until `done` holds (kernel lock held), sleeping
// until the instance of `end` (null: of any overlapped request) changes.
template <class Done>
void WaitProgress(const PipeEnd* end, Done done) {
  std::uint32_t keys[kernel::kMaxWaitKeys];
  for (;;) {
    ProgressAll();
    if (done()) return;
    std::uint32_t count = KeysToWaitOn(end, keys);
    // A peer found dead just now changed an instance: look again first.
    ProgressAll();
    if (done()) return;
    kernel::WaitKeys(keys, count, -1);
  }
}

void* ServiceThread(void*) {
  kernel::Lock lock;
  WaitProgress(nullptr, [] { return false; });
  return nullptr;
}

void EnsureServiceThread() {
  Process& process = GetProcess();
  if (process.serviceRunning) {
    kernel::Notify(ProcessKey());
    return;
  }
  pthread_t thread;
  pthread_attr_t attr;
  pthread_attr_init(&attr);
  pthread_attr_setdetachstate(&attr, PTHREAD_CREATE_DETACHED);
  pthread_attr_setstacksize(&attr, 256 * 1024);
  if (pthread_create(&thread, &attr, ServiceThread, nullptr) == 0) process.serviceRunning = true;
  pthread_attr_destroy(&attr);
}

}  // namespace

DWORD PipeEnd::Link(const PipeInstance& inst, std::uint32_t connection, bool write) const {
  if (server_) {
    if (inst.connection != connection) return ERROR_PIPE_NOT_CONNECTED;
    switch (inst.state) {
      case kernel::kPipeConnected:
        return ERROR_SUCCESS;
      case kernel::kPipeListening:
        return ERROR_PIPE_LISTENING;
      case kernel::kPipeClosing:
        return write ? ERROR_NO_DATA : ERROR_BROKEN_PIPE;
      default:
        return ERROR_PIPE_NOT_CONNECTED;
    }
  }
  if (inst.connection != connection_ || inst.state != kernel::kPipeConnected) {
    return ERROR_PIPE_NOT_CONNECTED;
  }
  if (inst.serverOpen == 0) return write ? ERROR_NO_DATA : ERROR_BROKEN_PIPE;
  return ERROR_SUCCESS;
}

bool PipeEnd::Attempt(PipeOp& op, DWORD* error, DWORD* bytes) {
  *bytes = 0;
  if (op.cancelled || closed_) {
    *error = ERROR_OPERATION_ABORTED;
    return true;
  }
  PipeInstance* inst = Instance();
  if (inst == nullptr) {
    *error = server_ ? ERROR_INVALID_HANDLE : ERROR_PIPE_NOT_CONNECTED;
    return true;
  }
  switch (op.kind) {
    case PipeOp::kConnect:
      if (inst->connection != op.connection) {
        *error = ERROR_SUCCESS;  // a client came (and may have gone again)
        return true;
      }
      if (inst->state == kernel::kPipeDisconnected) {
        *error = ERROR_PIPE_NOT_CONNECTED;
        return true;
      }
      return false;
    case PipeOp::kRead: {
      Ring queue = Incoming(*inst);
      DWORD link = Link(*inst, op.connection, false);
      // Data already sent stays readable after the other end has closed.
      bool drainable = link == ERROR_SUCCESS || link == ERROR_BROKEN_PIPE;
      if (drainable && queue.q->messages != 0) {
        *error = QueueRead(queue, messageRead_, op.readBuffer, op.length, bytes, true);
        kernel::Notify(kernel::PipeKey(index_));
        return true;
      }
      if (link != ERROR_SUCCESS) {
        *error = link;
        return true;
      }
      return false;
    }
    case PipeOp::kWrite: {
      DWORD link = Link(*inst, op.connection, true);
      if (link != ERROR_SUCCESS) {
        *error = link;
        return true;
      }
      if (op.length + kHeader > kCapacity) {
        *error = ERROR_NOT_ENOUGH_QUOTA;  // larger than a whole pipe buffer
        return true;
      }
      Ring queue = Outgoing(*inst);
      bool byteStream = (inst->pipeMode & PIPE_TYPE_MESSAGE) == 0;
      if (op.length == 0 && byteStream) {
        *error = ERROR_SUCCESS;
        return true;
      }
      if (!QueueFits(queue, op.length)) return false;
      QueuePush(queue, op.writeBuffer, op.length);
      *bytes = op.length;
      *error = ERROR_SUCCESS;
      kernel::Notify(kernel::PipeKey(index_));
      return true;
    }
  }
  return false;
}

BOOL PipeEnd::Issue(PipeOp::Kind kind, void* readBuffer, const void* writeBuffer, DWORD length,
                    DWORD* done, OVERLAPPED* overlapped, bool forceSynchronous) {
  bool asynchronous = !forceSynchronous && Overlapped() && overlapped != nullptr;
  std::shared_ptr<SlotObject> event;
  if (asynchronous) {
    if (!ResolveEvent(overlapped, &event)) return FALSE;
    StartOverlapped(overlapped, event);
  }
  auto op = std::make_shared<PipeOp>();
  op->kind = kind;
  op->end = shared_from_this();
  op->overlapped = overlapped;
  op->event = event;
  op->readBuffer = readBuffer;
  op->writeBuffer = writeBuffer;
  op->length = length;
  op->thread = kernel::ThreadId();
  op->synchronous = !asynchronous;

  DWORD error = ERROR_SUCCESS;
  DWORD bytes = 0;
  {
    kernel::Lock lock;
    PipeInstance* inst = Instance();
    // An end whose process has ended is closed before anything else happens,
    // as the system closes a process's handles when it ends.
    if (inst != nullptr) RefreshPeers(*inst);
    inst = Instance();
    if (inst == nullptr) {
      error = server_ ? ERROR_INVALID_HANDLE : ERROR_PIPE_NOT_CONNECTED;
    } else {
      op->connection = server_ ? inst->connection : connection_;
      bool finished = false;
      if (kind == PipeOp::kConnect) {
        // A client that came first, or went again, is reported at once.
        finished = true;
        if (inst->state == kernel::kPipeConnected) {
          error = ERROR_PIPE_CONNECTED;
        } else if (inst->state == kernel::kPipeClosing) {
          error = ERROR_NO_DATA;
        } else {
          if (inst->state == kernel::kPipeDisconnected) {
            kernel::Touch(inst->state);
            inst->state = kernel::kPipeListening;
            Changed(*inst);
          }
          finished = false;
        }
      } else if (kind == PipeOp::kRead && server_ && inst->state == kernel::kPipeListening) {
        finished = true;
        error = ERROR_PIPE_LISTENING;
      }
      if (!finished) {
        // Behind earlier requests of the same kind on this end, or waiting.
        bool queued = false;
        for (const auto& other : GetProcess().ops) {
          queued = queued || (other->end.get() == this && other->kind == kind);
        }
        if (!queued) finished = Attempt(*op, &error, &bytes);
      }
      if (!finished) {
        GetProcess().ops.push_back(op);
        if (asynchronous) {
          EnsureServiceThread();
          SetLastError(ERROR_IO_PENDING);
          return FALSE;
        }
        WaitProgress(this, [&] { return op->finished; });
        error = op->error;
        bytes = op->bytes;
      }
    }
  }
  if (asynchronous) return FinishAtOnce(overlapped, event, error, bytes, done);
  if (done != nullptr) *done = bytes;
  if (error != ERROR_SUCCESS) {
    SetLastError(error);
    return FALSE;
  }
  return TRUE;
}

int PipeEnd::Cancel(std::int32_t threadId, OVERLAPPED* overlapped) {
  kernel::Lock lock;
  int count = 0;
  OpList& ops = GetProcess().ops;
  for (auto it = ops.begin(); it != ops.end();) {
    PipeOp& op = **it;
    bool match =
        op.end.get() == this && (overlapped != nullptr ? op.overlapped == overlapped
                                                       : threadId == 0 || op.thread == threadId);
    if (!match) {
      ++it;
      continue;
    }
    ++count;
    if (op.synchronous) {
      op.cancelled = true;  // its waiting thread finishes it
      ++it;
      continue;
    }
    StoreOverlappedLocked(op.overlapped, op.event, ERROR_OPERATION_ABORTED, 0);
    it = ops.erase(it);
  }
  kernel::Notify(kernel::PipeKey(index_));
  return count;
}

BOOL PipeEnd::Flush() {
  kernel::Lock lock;
  DWORD error = ERROR_SUCCESS;
  WaitProgress(this, [&] {
    PipeInstance* inst = Instance();
    if (inst == nullptr) {
      error = ERROR_PIPE_NOT_CONNECTED;
      return true;
    }
    DWORD link = Link(*inst, server_ ? inst->connection : connection_, true);
    if (link != ERROR_SUCCESS) {
      error = link == ERROR_NO_DATA ? ERROR_BROKEN_PIPE : link;
      return true;
    }
    return Outgoing(*inst).q->messages == 0;
  });
  if (error != ERROR_SUCCESS) {
    SetLastError(error);
    return FALSE;
  }
  return TRUE;
}

void PipeEnd::HandleClosed() {
  kernel::Lock lock;
  closed_ = true;
  PipeInstance* inst = Instance();
  if (inst != nullptr) {
    kernel::Touch(*inst);
    if (server_) {
      inst->serverOpen = 0;
      QueueClear(inst->toServer);
    } else {
      if (inst->clientOpen != 0) --inst->clientOpen;
      if (inst->connection == connection_ && inst->state == kernel::kPipeConnected) {
        inst->state = kernel::kPipeClosing;
        QueueClear(inst->toClient);
      }
    }
    Changed(*inst);
    MaybeFree(*inst);
  }
  // Requests still waiting on this handle end as cancelled.
  ProgressAll();
  kernel::Notify(kernel::PipeKey(index_));
}

BOOL PipeEnd::Disconnect() {
  if (!server_) {
    SetLastError(ERROR_INVALID_FUNCTION);
    return FALSE;
  }
  kernel::Lock lock;
  PipeInstance* inst = Instance();
  if (inst == nullptr || inst->state == kernel::kPipeDisconnected) {
    SetLastError(ERROR_PIPE_NOT_CONNECTED);
    return FALSE;
  }
  kernel::Touch(*inst);
  QueueClear(inst->toClient);
  QueueClear(inst->toServer);
  inst->state = kernel::kPipeDisconnected;
  Changed(*inst);
  ProgressAll();
  return TRUE;
}

BOOL PipeEnd::SetState(const DWORD* mode, const DWORD* maxCollection, const DWORD* collectTimeout) {
  if (!canSetState_) {
    SetLastError(ERROR_ACCESS_DENIED);
    return FALSE;
  }
  // Collection settings exist only for remote clients.
  if (maxCollection != nullptr || collectTimeout != nullptr) {
    SetLastError(ERROR_INVALID_PARAMETER);
    return FALSE;
  }
  if (mode == nullptr) return TRUE;
  kernel::Lock lock;
  PipeInstance* inst = Instance();
  if (inst == nullptr) {
    SetLastError(ERROR_PIPE_NOT_CONNECTED);
    return FALSE;
  }
  bool message = (*mode & PIPE_READMODE_MESSAGE) != 0;
  if (message && (inst->pipeMode & PIPE_TYPE_MESSAGE) == 0) {
    SetLastError(ERROR_INVALID_PARAMETER);
    return FALSE;
  }
  messageRead_ = message;
  return TRUE;
}

BOOL PipeEnd::Peek(void* buffer, DWORD size, DWORD* bytesRead, DWORD* total, DWORD* left) {
  kernel::Lock lock;
  PipeInstance* inst = Instance();
  if (inst != nullptr) RefreshPeers(*inst);
  inst = Instance();
  DWORD link = inst == nullptr ? ERROR_PIPE_NOT_CONNECTED
                               : Link(*inst, server_ ? inst->connection : connection_, false);
  DWORD available = 0;
  DWORD inMessage = 0;
  DWORD copied = 0;
  if (inst != nullptr && (link == ERROR_SUCCESS || link == ERROR_BROKEN_PIPE)) {
    Ring queue = Incoming(*inst);
    QueueAvailable(queue, &available, &inMessage);
    if (queue.q->messages != 0 && buffer != nullptr) {
      QueueRead(queue, (inst->pipeMode & PIPE_TYPE_MESSAGE) != 0, buffer, size, &copied, false);
    }
    if (queue.q->messages != 0) link = ERROR_SUCCESS;
  }
  if (link != ERROR_SUCCESS) {
    SetLastError(link);
    return FALSE;
  }
  if (bytesRead != nullptr) *bytesRead = copied;
  if (total != nullptr) *total = available;
  if (left != nullptr) *left = (inst->pipeMode & PIPE_TYPE_MESSAGE) != 0 ? inMessage : 0;
  return TRUE;
}

bool IsPipePath(const WCHAR* path, const WCHAR** name) {
  static const char16_t kPrefix[] = u"\\\\.\\pipe\\";
  for (std::size_t i = 0; kPrefix[i] != 0; ++i) {
    WCHAR c = path[i];
    if (c >= u'A' && c <= u'Z') c = static_cast<WCHAR>(c - u'A' + u'a');
    if (c != kPrefix[i]) return false;
  }
  *name = path + (sizeof(kPrefix) / sizeof(kPrefix[0]) - 1);
  return true;
}

HANDLE OpenPipeClient(const WCHAR* name, DWORD access, DWORD flags) {
  WCHAR lower[kernel::kNameCapacity];
  if (!LowerName(name, lower)) {
    SetLastError(ERROR_FILE_NOT_FOUND);
    return INVALID_HANDLE_VALUE;
  }
  std::uint32_t index = 0;
  std::uint32_t generation = 0;
  std::uint32_t connection = 0;
  bool message = false;
  {
    kernel::Lock lock;
    kernel::Region& region = kernel::GetRegion();
    bool exists = false;
    int chosen = -1;
    for (std::uint32_t i = 0; i < kernel::kPipeInstanceCount; ++i) {
      PipeInstance& inst = region.pipes[i];
      if (inst.inUse == 0 || inst.serverOpen == 0 || !NameEqual(inst.name, lower)) continue;
      RefreshPeers(inst);
      if (inst.inUse == 0 || inst.serverOpen == 0) continue;
      exists = true;
      if (chosen < 0 && inst.state == kernel::kPipeListening) chosen = static_cast<int>(i);
    }
    if (chosen < 0) {
      SetLastError(exists ? ERROR_PIPE_BUSY : ERROR_FILE_NOT_FOUND);
      return INVALID_HANDLE_VALUE;
    }
    PipeInstance& inst = region.pipes[chosen];
    kernel::Touch(inst);
    QueueClear(inst.toClient);
    QueueClear(inst.toServer);
    inst.state = kernel::kPipeConnected;
    ++inst.connection;
    ++inst.clientOpen;
    inst.client = kernel::Self();
    index = static_cast<std::uint32_t>(chosen);
    generation = inst.generation;
    connection = inst.connection;
    message = false;  // clients start in byte read mode
    Changed(inst);
    ProgressAll();
  }
  bool all = (access & GENERIC_ALL) != 0;
  bool canRead = all || (access & (GENERIC_READ | FILE_READ_DATA)) != 0;
  bool canWrite = all || (access & (GENERIC_WRITE | FILE_WRITE_DATA)) != 0;
  bool canSetState = all || (access & (GENERIC_WRITE | FILE_WRITE_ATTRIBUTES)) != 0;
  auto end = std::make_shared<PipeEnd>(false, index, generation, connection,
                                       (flags & FILE_FLAG_OVERLAPPED) != 0, message, canRead,
                                       canWrite, canSetState);
  HANDLE handle = AllocateHandle(end);
  SetLastError(ERROR_SUCCESS);
  return handle;
}

namespace kernel {

void ClosePipeEndsOfProcess(const ProcessId& process) {
  for (PipeInstance& inst : GetRegion().pipes) {
    if (inst.inUse == 0) continue;
    bool changed = false;
    if (inst.serverOpen != 0 && SameProcess(inst.server, process)) {
      CloseServerEnd(inst);
      changed = true;
    }
    if (inst.clientOpen != 0 && SameProcess(inst.client, process)) {
      CloseClientEnd(inst);
      changed = true;
    }
    if (changed) {
      Changed(inst);
      MaybeFree(inst);
    }
  }
}

}  // namespace kernel

namespace {

std::shared_ptr<PipeEnd> LookupPipe(HANDLE handle) {
  auto end = LookupHandleAs<PipeEnd>(handle);
  if (end == nullptr) SetLastError(ERROR_INVALID_HANDLE);
  return end;
}

}  // namespace
}  // namespace emu

HANDLE CreateNamedPipeW(LPCWSTR name, DWORD openMode, DWORD pipeMode, DWORD maxInstances,
                        DWORD /*outBufferSize*/, DWORD /*inBufferSize*/, DWORD defaultTimeOut,
                        LPSECURITY_ATTRIBUTES /*securityAttributes*/) {
  const WCHAR* pipeName = nullptr;
  WCHAR lower[emu::kernel::kNameCapacity];
  if (name == nullptr || !emu::IsPipePath(name, &pipeName) || !emu::LowerName(pipeName, lower)) {
    SetLastError(ERROR_INVALID_NAME);
    return INVALID_HANDLE_VALUE;
  }
  DWORD access = openMode & PIPE_ACCESS_DUPLEX;
  bool messageType = (pipeMode & PIPE_TYPE_MESSAGE) != 0;
  bool messageRead = (pipeMode & PIPE_READMODE_MESSAGE) != 0;
  if (access == 0 || maxInstances == 0 || maxInstances > PIPE_UNLIMITED_INSTANCES ||
      (messageRead && !messageType)) {
    SetLastError(ERROR_INVALID_PARAMETER);
    return INVALID_HANDLE_VALUE;
  }
  std::uint32_t index = 0;
  std::uint32_t generation = 0;
  {
    emu::kernel::Lock lock;
    emu::kernel::Region& region = emu::kernel::GetRegion();
    DWORD count = 0;
    DWORD limit = 0;
    int free = -1;
    for (std::uint32_t i = 0; i < emu::kernel::kPipeInstanceCount; ++i) {
      emu::kernel::PipeInstance& inst = region.pipes[i];
      if (inst.inUse != 0) emu::RefreshPeers(inst);
      if (inst.inUse == 0) {
        if (free < 0) free = static_cast<int>(i);
        continue;
      }
      if (inst.serverOpen == 0 || !emu::NameEqual(inst.name, lower)) continue;
      if (count == 0) limit = inst.maxInstances;
      ++count;
    }
    if (count != 0 && (openMode & FILE_FLAG_FIRST_PIPE_INSTANCE) != 0) {
      SetLastError(ERROR_ACCESS_DENIED);
      return INVALID_HANDLE_VALUE;
    }
    if (count != 0 && count >= limit) {
      SetLastError(ERROR_PIPE_BUSY);
      return INVALID_HANDLE_VALUE;
    }
    if (free < 0) {
      SetLastError(ERROR_NOT_ENOUGH_MEMORY);
      return INVALID_HANDLE_VALUE;
    }
    emu::kernel::PipeInstance& inst = region.pipes[free];
    emu::kernel::Touch(inst);
    std::uint32_t keepGeneration = inst.generation;
    std::uint32_t keepConnection = inst.connection;
    inst.inUse = 1;
    inst.generation = keepGeneration;
    std::memcpy(inst.name, lower, sizeof(lower));
    inst.maxInstances = maxInstances;
    inst.openMode = openMode;
    inst.pipeMode = pipeMode;
    inst.defaultTimeout = defaultTimeOut;
    inst.state = emu::kernel::kPipeListening;
    inst.serverOpen = 1;
    inst.clientOpen = 0;
    inst.connection = keepConnection + 1;
    inst.server = emu::kernel::Self();
    inst.client = emu::kernel::ProcessId{};
    emu::QueueClear(inst.toClient);
    emu::QueueClear(inst.toServer);
    index = static_cast<std::uint32_t>(free);
    generation = inst.generation;
    emu::Changed(inst);
  }
  auto end = std::make_shared<emu::PipeEnd>(
      true, index, generation, 0, (openMode & FILE_FLAG_OVERLAPPED) != 0, messageRead,
      (access & PIPE_ACCESS_INBOUND) != 0, (access & PIPE_ACCESS_OUTBOUND) != 0, true);
  HANDLE handle = emu::AllocateHandle(end);
  SetLastError(ERROR_SUCCESS);
  return handle;
}

BOOL ConnectNamedPipe(HANDLE namedPipe, LPOVERLAPPED overlapped) {
  auto end = emu::LookupPipe(namedPipe);
  if (end == nullptr) return FALSE;
  return end->Connect(overlapped);
}

BOOL DisconnectNamedPipe(HANDLE namedPipe) {
  auto end = emu::LookupPipe(namedPipe);
  if (end == nullptr) return FALSE;
  return end->Disconnect();
}

BOOL WaitNamedPipeW(LPCWSTR namedPipeName, DWORD timeOut) {
  const WCHAR* pipeName = nullptr;
  WCHAR lower[emu::kernel::kNameCapacity];
  if (namedPipeName == nullptr || !emu::IsPipePath(namedPipeName, &pipeName) ||
      !emu::LowerName(pipeName, lower)) {
    SetLastError(ERROR_BAD_PATHNAME);
    return FALSE;
  }
  emu::kernel::Lock lock;
  emu::kernel::Region& region = emu::kernel::GetRegion();
  std::int64_t deadline = 0;
  bool first = true;
  for (;;) {
    bool exists = false;
    bool listening = false;
    DWORD defaultTimeout = 0;
    for (emu::kernel::PipeInstance& inst : region.pipes) {
      if (inst.inUse == 0 || inst.serverOpen == 0 || !emu::NameEqual(inst.name, lower)) continue;
      emu::RefreshPeers(inst);
      if (inst.inUse == 0 || inst.serverOpen == 0) continue;
      if (!exists) defaultTimeout = inst.defaultTimeout;
      exists = true;
      listening = listening || inst.state == emu::kernel::kPipeListening;
    }
    if (!exists) {
      SetLastError(ERROR_FILE_NOT_FOUND);
      return FALSE;
    }
    if (listening) return TRUE;
    if (first) {
      DWORD wait = timeOut;
      if (wait == NMPWAIT_USE_DEFAULT_WAIT) wait = defaultTimeout != 0 ? defaultTimeout : 50;
      deadline = emu::kernel::DeadlineAfter(emu::kernel::ScaleTimeout(wait));
      first = false;
    }
    if (deadline >= 0 && emu::kernel::NowNs() >= deadline) {
      SetLastError(ERROR_SEM_TIMEOUT);
      return FALSE;
    }
    const std::uint32_t key = emu::kernel::kPipeNamesKey;
    emu::kernel::WaitKeys(&key, 1, deadline);
  }
}

BOOL SetNamedPipeHandleState(HANDLE namedPipe, LPDWORD mode, LPDWORD maxCollectionCount,
                             LPDWORD collectDataTimeout) {
  auto end = emu::LookupPipe(namedPipe);
  if (end == nullptr) return FALSE;
  return end->SetState(mode, maxCollectionCount, collectDataTimeout);
}

BOOL TransactNamedPipe(HANDLE namedPipe, LPVOID inBuffer, DWORD inBufferSize, LPVOID outBuffer,
                       DWORD outBufferSize, LPDWORD bytesRead, LPOVERLAPPED overlapped) {
  auto end = emu::LookupPipe(namedPipe);
  if (end == nullptr) return FALSE;
  if (bytesRead != nullptr) *bytesRead = 0;
  return end->Transact(inBuffer, inBufferSize, outBuffer, outBufferSize, bytesRead, overlapped);
}

BOOL PeekNamedPipe(HANDLE namedPipe, LPVOID buffer, DWORD bufferSize, LPDWORD bytesRead,
                   LPDWORD totalBytesAvail, LPDWORD bytesLeftThisMessage) {
  auto end = emu::LookupPipe(namedPipe);
  if (end == nullptr) return FALSE;
  return end->Peek(buffer, bufferSize, bytesRead, totalBytesAvail, bytesLeftThisMessage);
}
