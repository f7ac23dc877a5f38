// Soak client: `stream` exchanges set-status requests until killed; `probe
// LIMIT_MS` exchanges one and exits 3 when it took longer than LIMIT_MS.
#include <chrono>
#include <cstdio>
#include <cstdlib>
#include <cstring>
#include <memory>

#include "pipe/command_message.h"
#include "pipe/pipe_client.h"

namespace {

// The service's own "ready" value, so the block stays sane.
constexpr DWORD kReady = 102;

bool ExchangeOnce(HANDLE pipe) {
  static auto request = std::make_unique<CommandMessage>();
  static auto reply = std::make_unique<CommandMessage>();
  InitCommand(request.get(), kCommandSetStatus, kReady);
  DWORD got = 0;
  return ExchangeCommand(pipe, request.get(), sizeof(*request), reply.get(), sizeof(*reply),
                         &got) &&
         got == sizeof(*reply) && reply->command == kCommandSetStatus;
}

int Stream() {
  for (;;) {
    HANDLE pipe = OpenCommandPipe(1000);
    if (pipe == INVALID_HANDLE_VALUE) {
      Sleep(10);
      continue;
    }
    while (ExchangeOnce(pipe)) {
    }
    CloseHandle(pipe);
  }
}

int Probe(long limitMs) {
  const auto start = std::chrono::steady_clock::now();
  HANDLE pipe = OpenCommandPipe(5000);
  const bool ok = pipe != INVALID_HANDLE_VALUE && ExchangeOnce(pipe);
  const std::chrono::duration<double, std::milli> elapsed =
      std::chrono::steady_clock::now() - start;
  if (!ok) {
    std::fprintf(stderr, "probe: %s failed: %lu\n",
                 pipe == INVALID_HANDLE_VALUE ? "open" : "exchange",
                 static_cast<unsigned long>(GetLastError()));
    return 1;
  }
  CloseHandle(pipe);
  std::printf("%.3f\n", elapsed.count());
  return elapsed.count() <= static_cast<double>(limitMs) ? 0 : 3;
}

}  // namespace

int main(int argc, char** argv) {
  if (argc == 2 && std::strcmp(argv[1], "stream") == 0) return Stream();
  if (argc == 3 && std::strcmp(argv[1], "probe") == 0) return Probe(std::atol(argv[2]));
  std::fprintf(stderr, "usage: soak_client stream | probe LIMIT_MS\n");
  return 2;
}
