#include <cstring>

#include "monitor/state_lock.h"
#include "monitor_fixture.h"
#include "support/test_support.h"

namespace {

using Publish = MonitorFixture;

TEST_F(Publish, CopiesOnlyWhenNeededOrForced) {
  StateBlock* block = monitorState.stateBlock;
  block->driveCount = 3;
  block->statusWord = 777;
  PublishStateBlock(monitorState.fileMapping, false);
  EXPECT_EQ(MappedCopy()->statusWord, 0u) << "published although nothing was needed";
  EXPECT_EQ(block->sequence, 0u);

  monitorState.publishNeeded = 1;
  PublishStateBlock(monitorState.fileMapping, false);
  EXPECT_EQ(monitorState.publishNeeded, 0u);
  EXPECT_EQ(block->sequence, 1u);
  StateBlock* copy = MappedCopy();
  EXPECT_EQ(copy->sequence, 1u) << "the copy carries the new sequence";
  EXPECT_EQ(copy->statusWord, 777u);
  EXPECT_EQ(copy->driveCount, 3);

  block->statusWord = 102;
  PublishStateBlock(monitorState.fileMapping, true);
  copy = MappedCopy();
  EXPECT_EQ(copy->sequence, 2u);
  EXPECT_EQ(copy->statusWord, 102u);
}

TEST_F(Publish, WholeBlockIsCopiedByteForByteExceptRowReferences) {
  static const WCHAR row[] = WSTR("row");
  StateBlock* block = monitorState.stateBlock;
  block->channels[63].ownIndex = 63;
  block->published[63].publishedIndex = 9;
  block->publishedCount = 1;
  block->drives[5].firmwareSerial[0] = 'A';
  block->drives[0].modelSuffixRef = row;
  block->drives[63].productLineRef = row;
  block->published[0].modelSuffixRef = row;
  block->published[63].productLineRef = row;
  PublishStateBlock(monitorState.fileMapping, true);
  StateBlock* copy = MappedCopy();
  // Addresses of the service never leave it.
  EXPECT_EQ(copy->drives[0].modelSuffixRef, nullptr);
  EXPECT_EQ(copy->drives[63].productLineRef, nullptr);
  EXPECT_EQ(copy->published[0].modelSuffixRef, nullptr);
  EXPECT_EQ(copy->published[63].productLineRef, nullptr);
  EXPECT_EQ(block->drives[0].modelSuffixRef, row) << "the working copy keeps them";
  block->drives[0].modelSuffixRef = nullptr;
  block->drives[63].productLineRef = nullptr;
  block->published[0].modelSuffixRef = nullptr;
  block->published[63].productLineRef = nullptr;
  EXPECT_EQ(std::memcmp(copy, block, sizeof(StateBlock)), 0);
}

TEST_F(Publish, FailedViewLosesOnlyThatPublish) {
  monitorState.publishNeeded = 1;
  PublishStateBlock(INVALID_HANDLE_VALUE, false);
  EXPECT_EQ(monitorState.stateBlock->sequence, 0u) << "sequence must not move without a copy";
  EXPECT_EQ(monitorState.publishNeeded, 0u);
}

TEST_F(Publish, RefreshRequestSetsCounterAndThreePasses) {
  RequestRefresh();
  RequestRefresh();
  EXPECT_EQ(monitorState.refreshRequests, 2u);
  EXPECT_EQ(monitorState.burstRequested, 1u);
  EXPECT_EQ(monitorState.gaugePassRequested, 1u);
  EXPECT_EQ(monitorState.sleepPassRequested, 1u);
  // The owner of the mutex may request too (the mutex is recursive).
  {
    StateLock lock;
    RequestRefresh();
  }
  EXPECT_EQ(monitorState.refreshRequests, 3u);
}

TEST_F(Publish, StateLockReleasesTheMutexItTookEvenWhenTheGlobalIsCleared) {
  const HANDLE mutex = monitorState.stateMutex;
  {
    StateLock lock;
    EXPECT_TRUE(lock.Owned());
    monitorState.stateMutex = nullptr;  // as the teardown does
  }
  monitorState.stateMutex = mutex;
  DWORD wait = WAIT_FAILED;
  HANDLE other = CreateThread(
      nullptr, 0,
      [](LPVOID parameter) -> DWORD {
        const DWORD result = WaitForSingleObject(*static_cast<HANDLE*>(parameter), 0);
        if (result == WAIT_OBJECT_0) ReleaseMutex(*static_cast<HANDLE*>(parameter));
        return result;
      },
      &monitorState.stateMutex, 0, nullptr);
  ASSERT_NE(other, nullptr);
  ASSERT_EQ(WaitForSingleObject(other, skytest::kGuardMs), WAIT_OBJECT_0);
  GetExitCodeThread(other, &wait);
  CloseHandle(other);
  EXPECT_EQ(wait, WAIT_OBJECT_0) << "the mutex stayed owned";
  // Without a mutex the guard owns nothing and releases nothing.
  monitorState.stateMutex = nullptr;
  {
    StateLock lock;
    EXPECT_FALSE(lock.Owned());
  }
  monitorState.stateMutex = mutex;
}

TEST_F(Publish, PublishedListSkipsDrivesWithoutExtendedIdentityOrStatusPage) {
  StateBlock* block = monitorState.stateBlock;
  block->driveCount = 2;
  block->drives[0].extendedIdentity = 0;
  block->drives[0].statusLevel = 2;
  block->drives[0].publishedIndex = 7;
  block->drives[1].extendedIdentity = 1;
  block->drives[1].fromChannel = 1;
  block->published[3].busKind = 2;
  block->publishedCount = 4;
  BuildPublishedList(block);
  EXPECT_EQ(block->publishedCount, 0);
  EXPECT_EQ(block->published[3].busKind, 0u) << "published array must be cleared";
  // Not polled: untouched.
  EXPECT_EQ(block->drives[0].statusLevel, 2);
  EXPECT_EQ(block->drives[0].publishedIndex, 7);
  // Polled, but no reachable drive returns page 0x82 here.
  EXPECT_EQ(block->drives[1].statusLevel, -1);
}

}  // namespace
