// `skyvane status`: reads the shared state block as the user-interface
// application does and prints it, as a table or (--json) as JSON; it can
// hold the block open and wait for a status word or a sequence number.
#include <cstdio>
#include <cstdlib>
#include <memory>
#include <string>

#include "block_reader.h"
#include "verbs.h"

namespace {

struct StatusOptions {
  bool json = false;
  bool waitOpen = false;  // retry until the service has created the objects
  std::string waitStatus;
  std::string waitSequence;  // wait until sequence reaches this value
  std::string timeoutMs = "10000";
};

DWORD Number(const std::string& text) {
  return static_cast<DWORD>(std::strtoul(text.c_str(), nullptr, 0));
}

void PrintTable(const StateBlock& b) {
  std::printf("sequence       %u\nstatusWord     %u\nchannelCount   %d\ndriveCount     %d\n",
              static_cast<unsigned>(b.sequence), static_cast<unsigned>(b.statusWord),
              static_cast<int>(b.channelCount), static_cast<int>(b.driveCount));
  std::printf("countedDrives  %d\npublishedCount %d\n", static_cast<int>(b.countedDrives),
              static_cast<int>(b.publishedCount));
  const int drives = Clamp(b.driveCount, kMaxDrives);
  std::printf("\nDrives (%d)\n  %-3s %-4s %-6s %-8s %-6s %-5s %-18s %s\n", drives, "#", "bus",
              "status", "letters", "chan", "pub", "serial", "model");
  for (int i = 0; i < drives; ++i) {
    const DriveRecord& d = b.drives[i];
    std::printf("  %-3d %-4u %-6u %-8s %-6d %-5d %-18s %s\n", i, static_cast<unsigned>(d.busKind),
                static_cast<unsigned>(d.statusCode), FIELD_TEXT(d, volumeLetters).c_str(),
                static_cast<int>(d.channelIndex), static_cast<int>(d.publishedIndex),
                FIELD_TEXT(d, firmwareSerial).c_str(), FIELD_TEXT(d, model).c_str());
  }
  const int channels = Clamp(b.channelCount, kMaxChannels);
  std::printf("\nChannels (%d)\n  %-3s %-4s %-4s %-6s %-6s %s\n", channels, "#", "kind", "mode",
              "drive", "gauge", "device path");
  for (int i = 0; i < channels; ++i) {
    const ChannelRecord& c = b.channels[i];
    std::printf("  %-3d %-4u %-4u %-6d %-6u %s\n", i, static_cast<unsigned>(c.kind),
                static_cast<unsigned>(c.mode), static_cast<int>(c.linkedDrive),
                static_cast<unsigned>(c.gaugePercentSent), FIELD_TEXT(c, devicePath).c_str());
  }
}

int RunStatus(const StatusOptions& options) {
  const ULONGLONG deadline = GetTickCount64() + Number(options.timeoutMs);
  BlockReader reader;
  std::string error;
  if (!reader.Open(options.waitOpen, deadline, &error)) {
    std::fprintf(stderr, "status: %s\n", error.c_str());
    return 1;
  }
  auto block = std::make_unique<StateBlock>();
  reader.Copy(block.get());
  int result = 0;
  const bool waitForStatus = !options.waitStatus.empty();
  const DWORD waitStatus = Number(options.waitStatus);
  const DWORD waitSequence = Number(options.waitSequence);
  if (waitForStatus || waitSequence != 0) {
    // The mapping stays open while waiting, so the block outlives the service.
    std::fprintf(stderr, "status: holding the state block\n");
    std::fflush(stderr);
    while ((waitForStatus && block->statusWord != waitStatus) || block->sequence < waitSequence) {
      if (GetTickCount64() >= deadline) {
        std::fprintf(stderr, "status: timed out at statusWord %u, sequence %u\n",
                     static_cast<unsigned>(block->statusWord),
                     static_cast<unsigned>(block->sequence));
        result = 3;
        break;
      }
      Sleep(20);
      reader.Copy(block.get());
    }
  }
  if (options.json) {
    std::printf("%s\n", BlockJson(*block).dump(2).c_str());
  } else {
    PrintTable(*block);
  }
  std::fflush(stdout);
  return result;
}

}  // namespace

void AddStatusVerb(CLI::App& app, int* exitCode) {
  auto options = std::make_shared<StatusOptions>();
  CLI::App* verb = app.add_subcommand("status", "Print the service's shared state block");
  verb->add_flag("--json", options->json, "Print JSON");
  verb->add_flag("--wait-open", options->waitOpen, "Wait until the service has created the block");
  verb->add_option("--wait-status", options->waitStatus, "Wait until statusWord is N")
      ->type_name("N");
  verb->add_option("--wait-sequence", options->waitSequence, "Wait until sequence reaches N")
      ->type_name("N");
  verb->add_option("--timeout-ms", options->timeoutMs, "Give up waiting after T ms (10000)")
      ->type_name("T");
  verb->callback([options, exitCode] { *exitCode = RunStatus(*options); });
}
