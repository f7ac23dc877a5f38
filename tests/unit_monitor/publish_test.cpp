#include <cstring>
#include <thread>

#include "monitor/state_lock.h"
#include "monitor_fixture.h"
#include "support/test_support.h"

namespace {

using Publish = MonitorFixture;

// Byte for byte except the row references: the service's addresses never
// leave it. A failed view loses only that publish.
TEST_F(Publish, CopiesTheWholeBlockOnlyWhenNeededOrForced) {
  static const WCHAR row[] = WSTR("row");
  StateBlock* block = monitorState.stateBlock;
  block->driveCount = 3;
  block->statusWord = 777;
  PublishStateBlock(monitorState.fileMapping, false);
  EXPECT_EQ(MappedCopy()->statusWord, 0u) << "published although nothing was needed";
  EXPECT_EQ(block->sequence, 0u);

  monitorState.publishNeeded = 1;
  PublishStateBlock(INVALID_HANDLE_VALUE, false);
  EXPECT_EQ(block->sequence, 0u) << "sequence moved without a copy";
  EXPECT_EQ(monitorState.publishNeeded, 0u);

  monitorState.publishNeeded = 1;
  PublishStateBlock(monitorState.fileMapping, false);
  EXPECT_EQ(monitorState.publishNeeded, 0u);
  EXPECT_EQ(block->sequence, 1u);
  EXPECT_EQ(MappedCopy()->sequence, 1u) << "the copy carries the new sequence";

  block->channels[63].ownIndex = 63;
  block->published[63].publishedIndex = 9;
  block->publishedCount = 1;
  block->drives[5].firmwareSerial[0] = 'A';
  const WCHAR** refs[] = {&block->drives[0].modelSuffixRef, &block->drives[63].productLineRef,
                          &block->published[0].modelSuffixRef,
                          &block->published[63].productLineRef};
  for (const WCHAR** ref : refs) *ref = row;
  PublishStateBlock(monitorState.fileMapping, true);
  StateBlock* copy = MappedCopy();
  EXPECT_EQ(copy->sequence, 2u);
  for (const WCHAR** ref : refs) {
    EXPECT_EQ(*ref, row) << "the working copy keeps its references";
    *ref = nullptr;
  }
  EXPECT_EQ(std::memcmp(copy, block, sizeof(StateBlock)), 0);
}

TEST_F(Publish, RefreshRequestSetsCounterAndThreePasses) {
  RequestRefresh();
  RequestRefresh();
  EXPECT_EQ(monitorState.refreshRequests, 2u);
  EXPECT_EQ(monitorState.burstRequested, 1u);
  EXPECT_EQ(monitorState.gaugePassRequested, 1u);
  EXPECT_EQ(monitorState.sleepPassRequested, 1u);
  {
    StateLock lock;  // the owner of the mutex may request too (it is recursive)
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
  std::thread other([&wait, mutex] {
    wait = WaitForSingleObject(mutex, 0);
    if (wait == WAIT_OBJECT_0) ReleaseMutex(mutex);
  });
  other.join();
  EXPECT_EQ(wait, WAIT_OBJECT_0) << "the mutex stayed owned";
  monitorState.stateMutex = nullptr;
  {
    StateLock lock;
    EXPECT_FALSE(lock.Owned()) << "a guard without a mutex owns nothing";
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
  EXPECT_EQ(block->drives[0].statusLevel, 2);
  EXPECT_EQ(block->drives[0].publishedIndex, 7);
  // Polled, but no reachable drive returns page 0x82 here.
  EXPECT_EQ(block->drives[1].statusLevel, -1);
}

}  // namespace
