// `skyvane sim ...` (host build): acts on the simulated machine of the host
// service running in the same emulation namespace, through the machine's
// control channel. The service process checks every request again; its
// reason for refusing one is printed as it comes.
#include <cctype>
#include <cstdio>
#include <fstream>
#include <memory>
#include <nlohmann/json.hpp>
#include <sstream>
#include <string>
#include <vector>

#include "control_protocol.h"
#include "pipe/pipe_client.h"
#include "verbs.h"

namespace {

struct SimArgs {
  std::string drive;
  std::string button;
  std::string file;
  std::string fault;
  std::string faultMs;
  std::string letter;
  std::string hex;
  std::string state;
  int percent = 0;
  bool json = false;
};

int Fail(const std::string& why) {
  std::fprintf(stderr, "skyvane sim: %s\n", why.c_str());
  return 2;
}

// Sends the request; prints the server's reason on a refusal. Exit code 0
// when done, 2 otherwise.
int Request(const std::vector<std::string>& words, std::string* output) {
  std::string reply;
  DWORD error = 0;
  if (!sim::ControlExchange(words, &reply, &error)) {
    return Fail("no simulated machine answers (error " + std::to_string(error) +
                "): is the host service running in this namespace?");
  }
  if (reply.rfind("ok\n", 0) == 0) {
    *output = reply.substr(3);
    return 0;
  }
  std::string why = reply.rfind("error\n", 0) == 0 ? reply.substr(6) : "unexpected reply";
  return Fail(words[0] + ": " + why);
}

int Simple(const std::vector<std::string>& words) {
  std::string output;
  const int code = Request(words, &output);
  if (code == 0) std::fputs(output.c_str(), stdout);
  return code;
}

// Forwards a device change to the service over its pipe (command 6), as the
// user-interface application forwards the broadcasts it receives: a service
// run in the foreground registers no device notifications and learns of
// arrivals only so. Best effort: the machine has acted either way.
void ForwardDeviceChange(DWORD eventType) {
  constexpr DWORD kDeviceChangeMessage = 0x219;
  HANDLE pipe = OpenCommandPipe(1000);
  if (pipe == INVALID_HANDLE_VALUE) return;
  auto message = std::make_unique<CommandMessage>();
  InitCommand(message.get(), kCommandForwardMessage, kDeviceChangeMessage, eventType, 0);
  auto reply = std::make_unique<CommandMessage>();
  DWORD received = 0;
  ExchangeCommand(pipe, message.get(), sizeof(CommandMessage), reply.get(), sizeof(CommandMessage),
                  &received);
  CloseHandle(pipe);
}

int Plugged(const std::vector<std::string>& words, DWORD eventType) {
  const int code = Simple(words);
  if (code == 0) ForwardDeviceChange(eventType);
  return code;
}

std::vector<std::string> Fields(const std::string& line, char separator) {
  std::vector<std::string> fields;
  std::stringstream in(line);
  std::string field;
  while (std::getline(in, field, separator)) fields.push_back(field);
  return fields;
}

std::string Size(unsigned long long bytes) {
  const char* units = "BKMGT";
  double value = static_cast<double>(bytes);
  int unit = 0;
  while (value >= 1024 && unit < 4) {
    value /= 1024;
    ++unit;
  }
  char text[32];
  std::snprintf(text, sizeof(text), "%.0f%c", value, units[unit]);
  return text;
}

int List(bool json) {
  std::string output;
  const int code = Request({"list"}, &output);
  if (code != 0) return code;
  nlohmann::ordered_json drives = nlohmann::ordered_json::array();
  for (const std::string& line : Fields(output, '\n')) {
    const auto f = Fields(line, '\t');
    if (f.size() < 8) continue;
    nlohmann::ordered_json drive = {{"index", std::stoi(f[0])},
                                    {"name", f[1]},
                                    {"bus", f[2]},
                                    {"channel", f[3]},
                                    {"plugged", f[4] == "1"},
                                    {"connected", f[5] == "1"},
                                    {"status", f[6]},
                                    {"sleepState", std::stoi(f[7])}};
    auto& volumes = drive["volumes"] = nlohmann::ordered_json::array();
    for (std::size_t i = 8; i < f.size(); ++i) {
      const auto v = Fields(f[i], ':');
      if (v.size() != 5) continue;
      volumes.push_back({{"letter", v[0]},
                         {"sizeBytes", std::stoull(v[1])},
                         {"freeBytes", std::stoull(v[2])},
                         {"held", v[3] == "1"},
                         {"present", v[4] == "1"}});
    }
    drives.push_back(drive);
  }
  if (json) {
    std::printf("%s\n", drives.dump(2).c_str());
    return 0;
  }
  std::printf("%-3s %-10s %-5s %-10s %-8s %-9s %-6s %s\n", "#", "name", "bus", "channel", "plugged",
              "status", "sleep", "volumes");
  for (const auto& d : drives) {
    std::string volumes;
    for (const auto& v : d["volumes"]) {
      const auto size = v["sizeBytes"].get<unsigned long long>();
      const auto free = v["freeBytes"].get<unsigned long long>();
      const unsigned long long used = size == 0 ? 0 : (size - free) * 100 / size;
      volumes += v["letter"].get<std::string>() + ": " + Size(size) + " " + std::to_string(used) +
                 "% used" + (v["held"].get<bool>() ? " held" : "") + "  ";
    }
    const bool plugged = d["plugged"].get<bool>();
    const char* state = plugged ? "yes" : d["connected"].get<bool>() ? "ejected" : "no";
    std::printf("%-3d %-10s %-5s %-10s %-8s %-9s %-6d %s\n", d["index"].get<int>(),
                d["name"].get<std::string>().c_str(), d["bus"].get<std::string>().c_str(),
                d["channel"].get<std::string>().c_str(), state,
                d["status"].get<std::string>().c_str(), d["sleepState"].get<int>(),
                volumes.c_str());
  }
  return 0;
}

int Add(const std::string& path) {
  std::ifstream file(path);
  std::stringstream text;
  if (!file || !(text << file.rdbuf())) return Fail("add: cannot read " + path);
  return Plugged({"add", text.str()}, 0x8000);
}

bool IsHexStatus(const std::string& text) {
  std::size_t digits = 0;
  for (const char c : text) {
    if (c == ' ') continue;
    if (std::isxdigit(static_cast<unsigned char>(c)) == 0) return false;
    ++digits;
  }
  return digits == 8;
}

}  // namespace

void AddSimVerbs(CLI::App& app, int* exitCode) {
  auto a = std::make_shared<SimArgs>();
  CLI::App* sim = app.add_subcommand(
      "sim", "Act on the host service's simulated machine (buttons, cables, faults, volumes)");
  sim->require_subcommand(1);
  const char* driveHelp = "The drive's name in the machine description, or its index";

  CLI::App* list = sim->add_subcommand("list", "List the drives and their volumes");
  list->add_flag("--json", a->json, "Print JSON");
  list->callback([a, exitCode] { *exitCode = List(a->json); });

  CLI::App* press = sim->add_subcommand("press", "Press a front-panel button");
  press->add_option("DRIVE", a->drive, driveHelp)->required();
  press->add_option("BUTTON", a->button, "eject, panel1 or panel2")->required();
  press->callback([a, exitCode] { *exitCode = Simple({"press", a->drive, a->button}); });

  CLI::App* unplug =
      sim->add_subcommand("unplug", "Pull the drive's cable: pending I/O ends with error 1167");
  unplug->add_option("DRIVE", a->drive, driveHelp)->required();
  unplug->callback([a, exitCode] { *exitCode = Plugged({"unplug", a->drive}, 0x8004); });

  CLI::App* plug = sim->add_subcommand("plug", "Plug the drive in (again)");
  plug->add_option("DRIVE", a->drive, driveHelp)->required();
  plug->callback([a, exitCode] { *exitCode = Plugged({"plug", a->drive}, 0x8000); });

  CLI::App* add =
      sim->add_subcommand("add", "Plug in new drives described in the machine text format");
  add->add_option("FILE", a->file, "A file of drive blocks (see sim/README.md)")->required();
  add->callback([a, exitCode] { *exitCode = Add(a->file); });

  CLI::App* fault = sim->add_subcommand("fault", "Make the drive's devices misbehave");
  fault->add_option("DRIVE", a->drive, driveHelp)->required();
  fault->add_option("FAULT", a->fault, "open, io, hang, slow-cancel or clear")->required();
  fault->add_option("MS", a->faultMs, "For slow-cancel: how long a cancel takes (ms)");
  fault->callback([a, exitCode] {
    std::vector<std::string> words = {"fault", a->drive, a->fault};
    if (!a->faultMs.empty()) words.push_back(a->faultMs);
    *exitCode = Simple(words);
  });

  CLI::App* hold =
      sim->add_subcommand("hold", "Another program keeps the volume open (ejects are vetoed)");
  hold->add_option("LETTER", a->letter, "Volume letter, e.g. E")->required();
  hold->callback([a, exitCode] { *exitCode = Simple({"hold", a->letter}); });

  CLI::App* release = sim->add_subcommand("release", "The other program closes the volume");
  release->add_option("LETTER", a->letter, "Volume letter, e.g. E")->required();
  release->callback([a, exitCode] { *exitCode = Simple({"release", a->letter}); });

  CLI::App* status = sim->add_subcommand("status", "Set the drive's status page bytes 4-7");
  status->add_option("DRIVE", a->drive, driveHelp)->required();
  status->add_option("HEX", a->hex, "Four bytes as 8 hexadecimal digits, e.g. 40000000")
      ->required();
  status->callback([a, exitCode] {
    *exitCode = IsHexStatus(a->hex) ? Simple({"status", a->drive, a->hex})
                                    : Fail("status: " + a->hex + " is not 8 hexadecimal digits");
  });

  CLI::App* sleep = sim->add_subcommand("sleep", "Set the drive's sleep state");
  sleep->add_option("DRIVE", a->drive, driveHelp)->required();
  sleep->add_option("STATE", a->state, "0 to 3")->required();
  sleep->callback([a, exitCode] { *exitCode = Simple({"sleep", a->drive, a->state}); });

  CLI::App* fill = sim->add_subcommand("fill", "Set how full the volume is (the gauge follows)");
  fill->add_option("LETTER", a->letter, "Volume letter, e.g. E")->required();
  fill->add_option("PERCENT", a->percent, "Used space, 0 to 100")
      ->required()
      ->check(CLI::Range(0, 100));
  fill->callback([a, exitCode] {
    *exitCode = Simple({"fill", a->letter, std::to_string(a->percent)});
  });
}
