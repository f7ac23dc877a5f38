// The pass-through transport's failures and aborts.
#include "transport/pass_through.h"

#include <gtest/gtest.h>

#include <cstring>
#include <thread>
#include <vector>

#include "discovery/device_interfaces.h"
#include "machine.h"
#include "service/process_locks.h"
#include "support/test_support.h"
#include "transport/io_block.h"

namespace {

constexpr char kDrive[] = "disk";

class PassThroughTest : public ::testing::Test {
 protected:
  void SetUp() override {
    InitializeProcessLocks();
    sim::DriveSpec spec;
    spec.name = kDrive;
    spec.channel = sim::ChannelKind::None;
    machine_.AddDrive(spec);
    machine_.Install();
    InterfaceList list(GUID_DEVINTERFACE_DISK);
    WideString path;
    SP_DEVINFO_DATA devInfo{};
    ASSERT_EQ(list.Member(0, &path, &devInfo), InterfaceList::Fetch::Ok);
    disk_.Reset(CreateFileW(path.c_str(), GENERIC_READ | GENERIC_WRITE,
                            FILE_SHARE_READ | FILE_SHARE_WRITE, nullptr, OPEN_EXISTING,
                            FILE_FLAG_OVERLAPPED, nullptr));
    ASSERT_TRUE(disk_.Valid());
    abort_.Reset(CreateEventW(nullptr, TRUE, FALSE, nullptr));
    ownEvent_.Reset(CreateEventW(nullptr, FALSE, FALSE, nullptr));
  }

  sim::Machine machine_;  // uninstalled after the handles below are closed
  skytest::Handle disk_;
  skytest::Handle abort_;
  skytest::Handle ownEvent_;
};

TEST_F(PassThroughTest, RejectedCommandsFailAndShortRepliesAreZeroFilled) {
  // CHECK CONDITION (status 2) for a page the drive does not have.
  BYTE page[20];
  EXPECT_EQ(ScsiInquiryPage(disk_.Get(), 0x83, page, sizeof(page), abort_.Get()),
            kScsiStatusErrorBase | 0x02);
  EXPECT_EQ(GetLastError(), kScsiStatusErrorBase | 0x02);

  // Page 0x00 of six pages is 10 bytes: the rest of the 20 asked for is zero.
  std::memset(page, 0xAA, sizeof(page));
  ASSERT_EQ(ScsiInquiryPage(disk_.Get(), 0x00, page, sizeof(page), abort_.Get()), 0u);
  EXPECT_EQ(page[9], 0xC1);
  for (std::size_t i = 10; i < sizeof(page); ++i) EXPECT_EQ(page[i], 0) << i;
}

// Runs `operation` while the disk holds every request pending, checks the
// pass-through lock meanwhile, then signals the abort event.
struct AbortOutcome {
  DWORD result = 0;
  DWORD lastError = 0;
};

template <typename Operation>
AbortOutcome AbortWhilePending(sim::Machine& machine, HANDLE abortEvent, bool expectLockHeld,
                               Operation operation) {
  machine.HangIo(kDrive, sim::Endpoint::Disk, true);
  AbortOutcome outcome;
  std::thread worker([&] {
    outcome.result = operation();
    outcome.lastError = GetLastError();
  });
  EXPECT_TRUE(machine.WaitForPending(kDrive, sim::Endpoint::Disk, 1, skytest::kGuardMs));
  const bool entered = TryEnterCriticalSection(&passThroughLock) != FALSE;
  if (entered) LeaveCriticalSection(&passThroughLock);
  EXPECT_EQ(entered, !expectLockHeld);
  SetEvent(abortEvent);
  worker.join();
  EXPECT_EQ(machine.PendingCount(kDrive, sim::Endpoint::Disk), 0u);
  machine.HangIo(kDrive, sim::Endpoint::Disk, false);
  ResetEvent(abortEvent);
  return outcome;
}

TEST_F(PassThroughTest, AbortEndsAPendingTransfer) {
  const HANDLE disk = disk_.Get();
  const HANDLE abortEvent = abort_.Get();

  BYTE inquiry[kInquiryLength] = {};
  AbortOutcome outcome = AbortWhilePending(machine_, abortEvent, true,
                                           [&] { return ScsiInquiry(disk, inquiry, abortEvent); });
  EXPECT_EQ(outcome.result, DWORD{ERROR_OPERATION_ABORTED});

  DWORD lastLba = 0;
  DWORD blockLength = 0;
  outcome = AbortWhilePending(machine_, abortEvent, false, [&] {
    return ScsiReadCapacity(disk, &lastLba, &blockLength, abortEvent);
  });
  EXPECT_EQ(outcome.result, DWORD{ERROR_OPERATION_ABORTED});

  OVERLAPPED overlapped{};
  overlapped.hEvent = ownEvent_.Get();
  BYTE status[8] = {};
  outcome = AbortWhilePending(machine_, abortEvent, true, [&] {
    return ReceiveDiagnosticPage(disk, 0x82, status, sizeof(status), &overlapped, abortEvent);
  });
  EXPECT_EQ(outcome.result, DWORD{ERROR_IO_PENDING});
  EXPECT_EQ(outcome.lastError, DWORD{ERROR_OPERATION_ABORTED});
  EXPECT_TRUE(HasOverlappedIoCompleted(&overlapped));

  // The handle stays usable after an abort.
  EXPECT_EQ(ScsiInquiry(disk, inquiry, abortEvent), 0u);
}

TEST_F(PassThroughTest, ACancelThatNeverEndsHoldsTheCallerOnlyForTheGrace) {
  // A cancel the drive never completes: each call returns after the grace, and
  // the late reply goes into the set-aside block, never the caller's buffers.
  machine_.SetCancelDelay(kDrive, sim::Endpoint::Disk, INFINITE);
  machine_.HangIo(kDrive, sim::Endpoint::Disk, true);
  SetEvent(abort_.Get());
  const std::size_t asideBefore = SetAsideIoBlockCount();

  BYTE inquiry[kInquiryLength] = {};
  EXPECT_EQ(ScsiInquiry(disk_.Get(), inquiry, abort_.Get()), DWORD{ERROR_OPERATION_ABORTED});
  EXPECT_EQ(SetAsideIoBlockCount(), asideBefore + 1);
  OVERLAPPED overlapped{};
  overlapped.hEvent = ownEvent_.Get();
  const BYTE page[5] = {0x81, 0x00, 0x00, 0x01, 0x05};
  EXPECT_EQ(SendDiagnosticPage(disk_.Get(), page, sizeof(page), &overlapped, abort_.Get()),
            DWORD{ERROR_IO_PENDING});
  EXPECT_EQ(GetLastError(), DWORD{ERROR_OPERATION_ABORTED});
  EXPECT_EQ(SetAsideIoBlockCount(), asideBefore + 2);
  STORAGE_DEVICE_NUMBER number{};
  DWORD bytes = 9;
  EXPECT_FALSE(IoControlWait(disk_.Get(), IOCTL_STORAGE_GET_DEVICE_NUMBER, nullptr, 0, &number,
                             sizeof(number), &bytes, abort_.Get()));
  EXPECT_EQ(bytes, 0u);
  EXPECT_EQ(SetAsideIoBlockCount(), asideBefore + 3);

  machine_.FinishHeldCancels();
  EXPECT_EQ(inquiry[8], 0) << "the late reply reached the set-aside block only";
  EXPECT_EQ(number.DeviceNumber, 0u);
  machine_.HangIo(kDrive, sim::Endpoint::Disk, false);
  ResetEvent(abort_.Get());
  EXPECT_EQ(SetAsideIoBlockCount(), asideBefore) << "freed once seen complete";
  EXPECT_EQ(ScsiInquiry(disk_.Get(), inquiry, abort_.Get()), 0u);
  FreeSetAsideIoBlocks();
}

}  // namespace
