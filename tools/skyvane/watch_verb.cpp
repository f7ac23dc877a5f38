// `skyvane watch`: the view the user-interface application has of the
// service, redrawn at each new sequence number of the shared block. On a
// terminal the screen is redrawn in place; with --once, or when standard
// output is not a terminal, each view is printed as plain text (no escape
// codes); --json prints one JSON object per view.
#include <cstdio>
#include <ctime>
#include <memory>
#include <string>

#ifdef _WIN32
#include <io.h>
#else
#include <unistd.h>
#endif

#include "block_reader.h"
#include "verbs.h"
#include "watch_view.h"

namespace {

// How often the sequence word is looked at. Nothing signals a publish, so
// the word is read (one aligned load, no lock) at this period and the block
// is copied under the mutex only when it changed.
constexpr DWORD kLookMs = 100;

struct WatchOptions {
  bool once = false;
  bool json = false;
  bool waitOpen = false;
  DWORD timeoutMs = 10000;
};

bool StdoutIsTerminal() {
#ifdef _WIN32
  if (_isatty(_fileno(stdout)) == 0) return false;
  // Consoles draw escape sequences once asked to.
  HANDLE console = GetStdHandle(STD_OUTPUT_HANDLE);
  DWORD mode = 0;
  if (GetConsoleMode(console, &mode)) SetConsoleMode(console, mode | 0x0004);
  return true;
#else
  return isatty(fileno(stdout)) != 0;
#endif
}

std::string Clock() {
  const std::time_t now = std::time(nullptr);
  char text[16] = "";
  if (const std::tm* local = std::localtime(&now))
    std::strftime(text, sizeof(text), "%H:%M:%S", local);
  return text;
}

void Draw(const WatchView& view, const StateBlock& block, const WatchOptions& options,
          bool terminal) {
  if (options.json) {
    std::printf("%s\n", view.Json(block).dump().c_str());
  } else if (terminal) {
    // Home, each line cleared to its end, then the rest of the screen.
    std::string screen = "\x1b[H";
    const std::string text = view.Render(block);
    std::size_t start = 0;
    while (start < text.size()) {
      const std::size_t end = text.find('\n', start);
      screen += text.substr(start, end - start) + "\x1b[K\n";
      start = end == std::string::npos ? text.size() : end + 1;
    }
    screen += "\x1b[J";
    std::fputs(screen.c_str(), stdout);
  } else {
    std::printf("%s\n", view.Render(block).c_str());
  }
  std::fflush(stdout);
}

int RunWatch(const WatchOptions& options) {
  BlockReader reader;
  std::string error;
  if (!reader.Open(options.waitOpen, GetTickCount64() + options.timeoutMs, &error)) {
    std::fprintf(stderr, "watch: %s; is the service running?\n", error.c_str());
    return 2;
  }
  const bool terminal = !options.once && !options.json && StdoutIsTerminal();
  if (terminal) std::fputs("\x1b[2J", stdout);
  auto block = std::make_unique<StateBlock>();
  WatchView view;
  reader.Copy(block.get());
  view.Update(*block, Clock());
  Draw(view, *block, options, terminal);
  if (options.once) return 0;
  for (;;) {
    Sleep(kLookMs);
    if (reader.PeekSequence() == block->sequence) continue;
    reader.Copy(block.get());
    view.Update(*block, Clock());
    Draw(view, *block, options, terminal);
  }
}

}  // namespace

void AddWatchVerb(CLI::App& app, int* exitCode) {
  auto options = std::make_shared<WatchOptions>();
  CLI::App* verb = app.add_subcommand(
      "watch", "Show the service's drives, channels and status word live, as the UI does");
  verb->add_flag("--once", options->once, "Print the view once, as plain text, and exit");
  verb->add_flag("--json", options->json, "Print each view as one line of JSON");
  verb->add_flag("--wait-open", options->waitOpen, "Wait for the service to create the block");
  verb->add_option("--timeout-ms", options->timeoutMs, "How long --wait-open waits (10000)")
      ->type_name("T");
  verb->callback([options, exitCode] { *exitCode = RunWatch(*options); });
}
