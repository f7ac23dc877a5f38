// Round trips of the service's command channel, as the user-interface
// application makes them: command 10 (status word) and a command 13 query,
// each on one connection, p50 and p99.
#include <memory>
#include <vector>

#include "figures.h"
#include "pipe/command_message.h"
#include "pipe/pipe_client.h"

namespace bench {
namespace {

// Times `rounds` exchanges of `request` (after a warm-up); empty on failure.
std::vector<double> TimeExchanges(HANDLE pipe, CommandMessage* request, DWORD length,
                                  int rounds) {
  auto reply = std::make_unique<CommandMessage>();
  std::vector<double> samples;
  for (int i = 0; i < rounds + 50; ++i) {
    const double start = NowMicros();
    DWORD got = 0;
    if (!ExchangeCommand(pipe, request, length, reply.get(), sizeof(*reply), &got) || got == 0) {
      return {};
    }
    if (i >= 50) samples.push_back(NowMicros() - start);
  }
  return samples;
}

void AddRoundTrip(const char* name, std::vector<double> samples, double floor,
                  std::vector<Figure>& figures) {
  const double p50 = Percentile(samples, 50);
  const double p99 = Percentile(samples, 99);
  const std::string base = name;
  figures.push_back({base + ", p50", "us", p50, "floor p50", floor > 0 ? p50 / floor : 0});
  figures.push_back({base + ", p99", "us", p99, "floor p50", floor > 0 ? p99 / floor : 0});
}

}  // namespace

bool MeasureCommands(const Options& options, double floor, std::vector<Figure>& figures) {
  HANDLE pipe = OpenCommandPipe(5000);
  if (pipe == INVALID_HANDLE_VALUE) return false;
  const int rounds = options.quick ? 200 : 5000;
  auto request = std::make_unique<CommandMessage>();
  // Command 10 keeps the status word at the service's own "ready" value.
  InitCommand(request.get(), kCommandSetStatus, 102);
  request->length = kCommandMinLength;
  std::vector<double> status = TimeExchanges(pipe, request.get(), kCommandMinLength, rounds);

  InitCommand(request.get(), kCommandRegistry);
  static const char kData[] = "benchmark";
  bool laidOut = LayOutRegistryRequest(request.get(), RootKeyValue(HKEY_CURRENT_USER),
                                       WSTR("Software"), WSTR("SkyvaneBench"), kRegistrySet,
                                       REG_BINARY, kData, sizeof(kData));
  auto reply = std::make_unique<CommandMessage>();
  DWORD got = 0;
  bool set = laidOut && ExchangeCommand(pipe, request.get(), sizeof(*request), reply.get(),
                                        sizeof(*reply), &got);
  request->registry.operation = kRegistryQuery;
  std::vector<double> query;
  if (set) query = TimeExchanges(pipe, request.get(), sizeof(*request), options.quick ? 100 : 2000);
  CloseHandle(pipe);
  if (status.empty() || query.empty()) return false;
  AddRoundTrip("command 10 round trip", status, floor, figures);
  AddRoundTrip("command 13 query round trip", query, floor, figures);
  return true;
}

}  // namespace bench
