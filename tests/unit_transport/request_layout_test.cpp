// The request block every pass-through operation hands to the port driver,
// captured byte for byte by a device that only records what it is sent.
#include <gtest/gtest.h>

#include <cstring>
#include <memory>
#include <vector>

#include "platform/posix/device_provider.h"
#include "service/process_locks.h"
#include "support/test_support.h"
#include "transport/pass_through.h"

namespace {

struct Captured {
  DWORD code = 0;
  DWORD inputLength = 0;
  DWORD outputLength = 0;
  bool sameBuffer = false;
  const void* input = nullptr;
  PassThroughRequest request{};
};

class RecordingDevice : public emu::DeviceFile {
 public:
  explicit RecordingDevice(std::vector<Captured>* log) : log_(log) {}
  emu::IoStart Control(DWORD code, const void* input, DWORD inputLength, void* output,
                       DWORD outputLength, const emu::IoRequestPtr&) override {
    Captured captured;
    captured.code = code;
    captured.inputLength = inputLength;
    captured.outputLength = outputLength;
    captured.sameBuffer = input == output;
    captured.input = input;
    if (input != nullptr && inputLength >= sizeof(PassThroughRequest)) {
      std::memcpy(&captured.request, input, sizeof(PassThroughRequest));
    }
    log_->push_back(captured);
    return emu::IoStart{false, ERROR_SUCCESS, outputLength};
  }
  emu::IoStart Read(void*, DWORD, const emu::IoRequestPtr&) override {
    return {false, ERROR_INVALID_FUNCTION, 0};
  }
  emu::IoStart Write(const void*, DWORD, const emu::IoRequestPtr&) override {
    return {false, ERROR_INVALID_FUNCTION, 0};
  }

 private:
  std::vector<Captured>* log_;
};

class RecordingProvider : public emu::DeviceProvider {
 public:
  std::unique_ptr<emu::DeviceFile> Open(const WCHAR*, DWORD, DWORD, DWORD, DWORD*) override {
    return std::make_unique<RecordingDevice>(&log);
  }
  std::vector<Captured> log;
};

class RequestLayoutTest : public ::testing::Test {
 protected:
  void SetUp() override {
    InitializeProcessLocks();
    emu::SetDeviceProvider(&provider_);
    device_.Reset(CreateFileW(WSTR("\\\\?\\recorder"), GENERIC_READ | GENERIC_WRITE, 0, nullptr,
                              OPEN_EXISTING, FILE_FLAG_OVERLAPPED, nullptr));
    ASSERT_TRUE(device_.Valid());
    event_.Reset(CreateEventW(nullptr, FALSE, FALSE, nullptr));
  }
  void TearDown() override {
    device_.Reset();
    event_.Reset();
    emu::SetDeviceProvider(nullptr);
  }

  // The common fields of every request, and the command's own. The device
  // reads and writes a copy of the data right behind the request, in the
  // request's own block, never the caller's buffer; everything else,
  // padding included, is zero.
  void ExpectRequest(const Captured& captured, BYTE cdbLength, BYTE dataIn, DWORD dataLength,
                     std::vector<BYTE> cdb) {
    EXPECT_EQ(captured.code, 0x4D014u);
    EXPECT_EQ(captured.inputLength, 80u);
    EXPECT_EQ(captured.outputLength, 80u);
    EXPECT_TRUE(captured.sameBuffer);
    PassThroughRequest expected{};
    SCSI_PASS_THROUGH_DIRECT& spt = expected.spt;
    spt.Length = 56;
    spt.CdbLength = cdbLength;
    spt.SenseInfoLength = 18;
    spt.DataIn = dataIn;
    spt.DataTransferLength = dataLength;
    spt.TimeOutValue = 20;
    spt.DataBuffer = const_cast<BYTE*>(static_cast<const BYTE*>(captured.input) + 80);
    spt.SenseInfoOffset = 60;
    std::copy(cdb.begin(), cdb.end(), spt.Cdb);
    expected.totalLength = 80;
    EXPECT_EQ(std::memcmp(&captured.request, &expected, sizeof(expected)), 0) << int{cdb[0]};
  }

  RecordingProvider provider_;
  skytest::Handle device_;
  skytest::Handle event_;
};

TEST_F(RequestLayoutTest, EveryOperationFillsTheBlockAsTheDriverExpects) {
  DWORD lastLba = 0;
  DWORD blockLength = 0;
  ASSERT_EQ(ScsiReadCapacity(device_.Get(), &lastLba, &blockLength, nullptr), 0u);
  BYTE inquiry[kInquiryLength];
  ASSERT_EQ(ScsiInquiry(device_.Get(), inquiry, nullptr), 0u);
  BYTE page[36];
  ASSERT_EQ(ScsiInquiryPage(device_.Get(), 0xC1, page, 36, nullptr), 0u);
  OVERLAPPED overlapped{};
  overlapped.hEvent = event_.Get();
  BYTE status[8];
  ASSERT_EQ(ReceiveDiagnosticPage(device_.Get(), 0x83, status, 8, &overlapped, nullptr), 0u);
  const BYTE gauge[6] = {0x81, 0, 0, 2, 0x0F, 0x03};
  overlapped = OVERLAPPED{};
  overlapped.hEvent = event_.Get();
  ASSERT_EQ(SendDiagnosticPage(device_.Get(), gauge, 6, &overlapped, nullptr), 0u);

  const std::vector<Captured>& log = provider_.log;
  ASSERT_EQ(log.size(), 5u);
  ExpectRequest(log[0], 10, SCSI_IOCTL_DATA_IN, 8, {0x25, 0, 0, 0, 0, 0, 0, 0, 0, 0});
  ExpectRequest(log[1], 6, SCSI_IOCTL_DATA_IN, 74, {0x12, 0, 0, 0, 74, 0});
  ExpectRequest(log[2], 6, SCSI_IOCTL_DATA_IN, 36, {0x12, 0x01, 0xC1, 0, 36, 0});
  ExpectRequest(log[3], 6, SCSI_IOCTL_DATA_IN, 8, {0x1C, 0x01, 0x83, 0, 8, 0});
  ExpectRequest(log[4], 6, SCSI_IOCTL_DATA_OUT, 6, {0x1D, 0x10, 0, 0, 6, 0});
}

}  // namespace
