#include <cstring>

#include "monitor/state_lock.h"
#include "monitor_fixture.h"

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

TEST_F(Publish, WholeBlockIsCopiedByteForByte) {
  StateBlock* block = monitorState.stateBlock;
  block->channels[63].ownIndex = 63;
  block->published[63].publishedIndex = 9;
  block->publishedCount = 1;
  block->drives[5].firmwareSerial[0] = 'A';
  PublishStateBlock(monitorState.fileMapping, true);
  EXPECT_EQ(std::memcmp(MappedCopy(), block, sizeof(StateBlock)), 0);
}

TEST_F(Publish, FailedViewLosesOnlyThatPublish) {
  monitorState.publishNeeded = 1;
  PublishStateBlock(nullptr, false);
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
