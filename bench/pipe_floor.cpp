// The floor a command round trip is compared with: one message-mode pipe
// echo of a command's size plus one copy of the state block, the least the
// service must do for a request.
#include <cstring>
#include <string>
#include <vector>

#include "figures.h"
#include "platform/wide.h"
#include "platform/win32.h"

namespace bench {
namespace {

constexpr DWORD kMessageBytes = 9896;
constexpr std::size_t kBlockBytes = 1215512;

struct Echo {
  HANDLE pipe = INVALID_HANDLE_VALUE;
  std::vector<unsigned char> source = std::vector<unsigned char>(kBlockBytes, 0x5A);
  std::vector<unsigned char> copy = std::vector<unsigned char>(kBlockBytes);
};

DWORD WINAPI EchoServer(LPVOID argument) {
  auto* echo = static_cast<Echo*>(argument);
  if (!ConnectNamedPipe(echo->pipe, nullptr) && GetLastError() != ERROR_PIPE_CONNECTED) return 1;
  std::vector<unsigned char> message(kMessageBytes);
  for (;;) {
    DWORD got = 0;
    if (!ReadFile(echo->pipe, message.data(), kMessageBytes, &got, nullptr)) break;
    std::memcpy(echo->copy.data(), echo->source.data(), kBlockBytes);
    DWORD put = 0;
    if (!WriteFile(echo->pipe, message.data(), got, &put, nullptr)) break;
  }
  DisconnectNamedPipe(echo->pipe);
  return 0;
}

}  // namespace

double MeasureFloor(const Options& options, std::vector<Figure>& figures) {
  std::string name = "\\\\.\\pipe\\SkyvaneBenchFloor-" + std::to_string(GetCurrentProcessId());
  WideString wide = Utf8ToWide(name);
  Echo echo;
  echo.pipe = CreateNamedPipeW(wide.c_str(), PIPE_ACCESS_DUPLEX,
                               PIPE_TYPE_MESSAGE | PIPE_READMODE_MESSAGE | PIPE_WAIT, 1,
                               kMessageBytes, kMessageBytes, 0, nullptr);
  if (echo.pipe == INVALID_HANDLE_VALUE) return 0.0;
  HANDLE server = CreateThread(nullptr, 0, EchoServer, &echo, 0, nullptr);
  HANDLE client = CreateFileW(wide.c_str(), GENERIC_READ | GENERIC_WRITE, 0, nullptr,
                              OPEN_EXISTING, 0, nullptr);
  DWORD mode = PIPE_READMODE_MESSAGE;
  SetNamedPipeHandleState(client, &mode, nullptr, nullptr);
  std::vector<unsigned char> request(kMessageBytes, 1);
  std::vector<unsigned char> reply(kMessageBytes);
  const int rounds = options.quick ? 200 : 5000;
  std::vector<double> samples;
  for (int i = 0; i < rounds + 50; ++i) {
    const double start = NowMicros();
    DWORD put = 0;
    DWORD got = 0;
    if (!WriteFile(client, request.data(), kMessageBytes, &put, nullptr) ||
        !ReadFile(client, reply.data(), kMessageBytes, &got, nullptr)) {
      break;
    }
    if (i >= 50) samples.push_back(NowMicros() - start);  // the first ones warm up
  }
  CloseHandle(client);
  WaitForSingleObject(server, INFINITE);
  CloseHandle(server);
  CloseHandle(echo.pipe);
  std::vector<double> sorted = samples;
  const double p50 = Percentile(sorted, 50);
  figures.push_back({"floor: pipe echo of 9,896 bytes + copy of 1,215,512 bytes, p50", "us", p50,
                     "", 0});
  figures.push_back({"floor: pipe echo of 9,896 bytes + copy of 1,215,512 bytes, p99", "us",
                     Percentile(sorted, 99), "", 0});
  return p50;
}

}  // namespace bench
