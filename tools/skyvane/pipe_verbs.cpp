// The verbs that talk to the service over its pipe:
//   pause | resume | set-status VALUE
//   reg get ROOT\PATH NAME
//   reg set ROOT\PATH NAME TYPE DATA      TYPE: sz, expand_sz, dword, qword, binary (hex)
//   send LENGTH COMMAND [ARG1 [ARG2 [ARG3]]] [--bytes N]
// Each prints the result and detail of the reply in words and exits 0 only
// when the service did what was asked.
#include <cstdio>
#include <cstdlib>
#include <cstring>
#include <memory>
#include <string>
#include <vector>

#include "pipe/command_message.h"
#include "pipe/pipe_client.h"
#include "platform/wide.h"
#include "platform/win32.h"
#include "verbs.h"

namespace {

constexpr DWORD kBusyWaitMs = 5000;

struct Reply {
  std::vector<BYTE> bytes;
  DWORD Field(std::size_t offset) const {
    DWORD value = 0;
    if (bytes.size() >= offset + sizeof(value)) std::memcpy(&value, bytes.data() + offset, 4);
    return value;
  }
  DWORD Result() const { return Field(offsetof(CommandMessage, result)); }
  DWORD Detail() const { return Field(offsetof(CommandMessage, detail)); }
};

// Sends `sent` bytes of `request`; false (with a message) when the pipe
// cannot be opened or the exchange fails.
bool Exchange(const void* request, DWORD sent, Reply* reply) {
  HANDLE pipe = OpenCommandPipe(kBusyWaitMs);
  if (pipe == INVALID_HANDLE_VALUE) {
    std::fprintf(stderr, "cannot open the service's pipe (error %lu)\n",
                 static_cast<unsigned long>(GetLastError()));
    return false;
  }
  reply->bytes.assign(2 * kCommandMaxLength, 0);
  DWORD received = 0;
  const bool ok = ExchangeCommand(pipe, request, sent, reply->bytes.data(),
                                  static_cast<DWORD>(reply->bytes.size()), &received);
  const DWORD error = GetLastError();
  CloseHandle(pipe);
  if (!ok) {
    std::fprintf(stderr, "the service closed the connection without a reply (error %lu)\n",
                 static_cast<unsigned long>(error));
    return false;
  }
  reply->bytes.resize(received);
  return true;
}

std::string ErrorWords(DWORD code) {
  switch (code) {
    case ERROR_SUCCESS:
      return "success";
    case ERROR_FILE_NOT_FOUND:
      return "not found";
    case ERROR_PATH_NOT_FOUND:
      return "path not found";
    case ERROR_ACCESS_DENIED:
      return "access denied";
    case ERROR_INVALID_HANDLE:
      return "invalid handle";
    case ERROR_INVALID_PARAMETER:
      return "invalid parameter (request refused)";
    case ERROR_MORE_DATA:
      return "more data than the area holds";
    case ERROR_NOT_SUPPORTED:
      return "not supported";
    case kCommandUnknownResult:
      return "unknown command";
    default:
      return "error";
  }
}

void PrintOutcome(const Reply& reply, const char* resultWords) {
  std::printf("result: %lu (%s)\ndetail: %lu\n", static_cast<unsigned long>(reply.Result()),
              resultWords, static_cast<unsigned long>(reply.Detail()));
}

bool ParseNumber(const char* text, std::uint64_t* value) {
  if (text == nullptr || *text == '\0') return false;
  char* end = nullptr;
  const bool negative = text[0] == '-';
  const unsigned long long magnitude = std::strtoull(negative ? text + 1 : text, &end, 0);
  if (end == nullptr || *end != '\0') return false;
  *value = negative ? 0 - magnitude : magnitude;
  return true;
}

bool ParseDword(const char* text, DWORD* value) {
  std::uint64_t wide = 0;
  if (!ParseNumber(text, &wide)) return false;
  *value = static_cast<DWORD>(wide);
  return true;
}

// A command without data; `success` is the result that means it was done.
int SimpleCommand(DWORD command, DWORD arg1, DWORD success) {
  auto message = std::make_unique<CommandMessage>();
  InitCommand(message.get(), command, arg1);
  Reply reply;
  if (!Exchange(message.get(), sizeof(CommandMessage), &reply)) return 1;
  if (reply.bytes.size() != sizeof(CommandMessage)) {
    std::fprintf(stderr, "unexpected reply of %zu bytes\n", reply.bytes.size());
    return 1;
  }
  const bool done = reply.Result() == success && reply.Detail() == 0;
  PrintOutcome(reply, done ? "done" : "failed");
  return done ? 0 : 1;
}

// "HKLM\Software\X" -> root and path.
bool SplitKey(const char* text, HKEY* root, WideString* path) {
  const std::string key = text;
  const std::size_t slash = key.find('\\');
  const std::string head = key.substr(0, slash);
  struct Root {
    const char* shortName;
    const char* longName;
    HKEY key;
  };
  const Root roots[] = {{"HKCR", "HKEY_CLASSES_ROOT", HKEY_CLASSES_ROOT},
                        {"HKCU", "HKEY_CURRENT_USER", HKEY_CURRENT_USER},
                        {"HKLM", "HKEY_LOCAL_MACHINE", HKEY_LOCAL_MACHINE},
                        {"HKU", "HKEY_USERS", HKEY_USERS},
                        {"HKCC", "HKEY_CURRENT_CONFIG", HKEY_CURRENT_CONFIG}};
  for (const Root& candidate : roots) {
    if (head == candidate.shortName || head == candidate.longName) {
      *root = candidate.key;
      *path = Utf8ToWide(slash == std::string::npos ? std::string() : key.substr(slash + 1));
      return true;
    }
  }
  std::fprintf(stderr, "unknown root key in %s (use HKCR, HKCU, HKLM, HKU or HKCC)\n", text);
  return false;
}

struct TypeName {
  const char* name;
  DWORD type;
};
constexpr TypeName kTypes[] = {{"sz", REG_SZ},         {"expand_sz", REG_EXPAND_SZ},
                               {"dword", REG_DWORD},   {"qword", REG_QWORD},
                               {"binary", REG_BINARY}, {"multi_sz", REG_MULTI_SZ}};

const char* TypeText(DWORD type) {
  for (const TypeName& entry : kTypes) {
    if (entry.type == type) return entry.name;
  }
  return "other";
}

bool EncodeData(const char* typeText, const char* text, DWORD* type, std::vector<BYTE>* data) {
  const std::string name = typeText;
  if (name == "sz" || name == "expand_sz") {
    *type = name == "sz" ? REG_SZ : REG_EXPAND_SZ;
    const WideString wide = Utf8ToWide(text);
    data->resize((wide.size() + 1) * sizeof(WCHAR), 0);
    std::memcpy(data->data(), wide.c_str(), wide.size() * sizeof(WCHAR));
    return true;
  }
  if (name == "dword" || name == "qword") {
    std::uint64_t value = 0;
    if (!ParseNumber(text, &value)) return false;
    *type = name == "dword" ? REG_DWORD : REG_QWORD;
    data->resize(name == "dword" ? 4 : 8);
    std::memcpy(data->data(), &value, data->size());  // little-endian
    return true;
  }
  if (name == "binary") {
    *type = REG_BINARY;
    const std::string hex = text;
    if (hex.size() % 2 != 0) return false;
    for (std::size_t i = 0; i < hex.size(); i += 2) {
      char* end = nullptr;
      const std::string pair = hex.substr(i, 2);
      const unsigned long byte = std::strtoul(pair.c_str(), &end, 16);
      if (*end != '\0') return false;
      data->push_back(static_cast<BYTE>(byte));
    }
    return true;
  }
  return false;
}

void PrintData(DWORD type, const BYTE* data, DWORD length) {
  std::printf("type: %s (%lu)\n", TypeText(type), static_cast<unsigned long>(type));
  if ((type == REG_SZ || type == REG_EXPAND_SZ) && length >= sizeof(WCHAR)) {
    std::vector<WCHAR> text(length / sizeof(WCHAR) + 1, 0);
    std::memcpy(text.data(), data, length / sizeof(WCHAR) * sizeof(WCHAR));
    std::printf("data: %s\n",
                WideToUtf8(WideView(text.data(), WideLength(text.data(), text.size()))).c_str());
  } else if (type == REG_DWORD && length == 4) {
    DWORD value = 0;
    std::memcpy(&value, data, 4);
    std::printf("data: %lu\n", static_cast<unsigned long>(value));
  } else if (type == REG_QWORD && length == 8) {
    std::uint64_t value = 0;
    std::memcpy(&value, data, 8);
    std::printf("data: %llu\n", static_cast<unsigned long long>(value));
  } else {
    std::printf("data: ");
    for (DWORD i = 0; i < length; ++i) std::printf("%02x", data[i]);
    std::printf("\n");
  }
}

struct RegistryArgs {
  std::string key;
  std::string name;
  std::string type;
  std::string data;
};

int RegistryVerb(const std::string& action, const RegistryArgs& args) {
  HKEY root = nullptr;
  WideString path;
  if (!SplitKey(args.key.c_str(), &root, &path)) return 2;
  const WideString name = Utf8ToWide(args.name);
  auto message = std::make_unique<CommandMessage>();
  InitCommand(message.get(), kCommandRegistry);

  if (action == "get") {
    // The data area takes all the room the message has left.
    if (!LayOutRegistryRequest(message.get(), RootKeyValue(root), path.c_str(), name.c_str(),
                               kRegistryQuery, REG_NONE, nullptr, 0)) {
      std::fprintf(stderr, "key path and name do not fit in one request\n");
      return 2;
    }
    const std::size_t used =
        static_cast<std::size_t>(message->registry.nameOffset + message->registry.dataOffset);
    message->registry.dataLength = static_cast<DWORD>(sizeof(message->registryText) - used);
  } else {
    DWORD type = 0;
    std::vector<BYTE> data;
    if (!EncodeData(args.type.c_str(), args.data.c_str(), &type, &data)) {
      std::fprintf(stderr, "cannot read %s as %s data\n", args.data.c_str(), args.type.c_str());
      return 2;
    }
    if (!LayOutRegistryRequest(message.get(), RootKeyValue(root), path.c_str(), name.c_str(),
                               kRegistrySet, type, data.data(), static_cast<DWORD>(data.size()))) {
      std::fprintf(stderr, "key path, name and data do not fit in one request\n");
      return 2;
    }
  }

  Reply reply;
  if (!Exchange(message.get(), sizeof(CommandMessage), &reply)) return 1;
  if (reply.bytes.size() != sizeof(CommandMessage)) {
    std::fprintf(stderr, "unexpected reply of %zu bytes\n", reply.bytes.size());
    return 1;
  }
  const DWORD result = reply.Result();
  std::printf("result: %lu (%s)\ndetail: %lu (data length)\n", static_cast<unsigned long>(result),
              ErrorWords(result).c_str(), static_cast<unsigned long>(reply.Detail()));
  if (result != ERROR_SUCCESS) return 1;
  if (action == "get") {
    CommandMessage answer;
    std::memcpy(&answer, reply.bytes.data(), sizeof(answer));
    const DWORD length = answer.registry.dataLength;
    const std::size_t used =
        static_cast<std::size_t>(message->registry.nameOffset + message->registry.dataOffset);
    if (length > sizeof(answer.registryText) - used) return 1;
    PrintData(answer.registry.valueType, answer.registryText + used, length);
  }
  return 0;
}

// Raw request for tests: a message declaring LENGTH (any 64-bit value), of
// which --bytes N are sent (default: LENGTH, at most twice the largest
// message). Prints the reply's length, result and detail.
struct SendArgs {
  std::vector<std::string> words;  // LENGTH COMMAND [ARG1 [ARG2 [ARG3]]]
  std::string bytes;
};

int SendVerb(const SendArgs& args) {
  std::uint64_t declared = 0;
  DWORD command = 0;
  DWORD values[3] = {};
  std::uint64_t sent = 0;
  bool ok = args.words.size() >= 2 && ParseNumber(args.words[0].c_str(), &declared) &&
            ParseDword(args.words[1].c_str(), &command);
  for (std::size_t i = 2; ok && i < args.words.size(); ++i) {
    ok = ParseDword(args.words[i].c_str(), &values[i - 2]);
  }
  if (ok && !args.bytes.empty()) ok = ParseNumber(args.bytes.c_str(), &sent);
  if (!ok) {
    std::fprintf(stderr, "send: LENGTH, COMMAND, the arguments and --bytes are numbers\n");
    return 2;
  }
  if (args.bytes.empty()) sent = declared;
  if (sent > 2 * kCommandMaxLength) {
    std::fprintf(stderr, "at most %lu bytes can be sent\n",
                 static_cast<unsigned long>(2 * kCommandMaxLength));
    return 2;
  }
  std::vector<BYTE> request(2 * kCommandMaxLength, 0);
  auto message = std::make_unique<CommandMessage>();
  InitCommand(message.get(), command, values[0], values[1], values[2]);
  message->length = declared;
  std::memcpy(request.data(), message.get(), sizeof(CommandMessage));
  Reply reply;
  if (!Exchange(request.data(), static_cast<DWORD>(sent), &reply)) return 1;
  std::printf("reply length: %zu\n", reply.bytes.size());
  if (reply.bytes.empty()) {
    std::printf("empty reply (request not handled)\n");
    return 0;
  }
  PrintOutcome(reply, reply.Result() == kCommandUnknownResult ? "unknown command" : "as replied");
  return 0;
}

}  // namespace

void AddPipeVerbs(CLI::App& app, int* exitCode) {
  app.add_subcommand("pause", "Pause the service's polling")->callback([exitCode] {
    *exitCode = SimpleCommand(kCommandPause, 0, 0);
  });
  app.add_subcommand("resume", "Resume the service's polling")->callback([exitCode] {
    *exitCode = SimpleCommand(kCommandResume, 0, 0);
  });
  auto value = std::make_shared<std::string>();
  CLI::App* setStatus = app.add_subcommand("set-status", "Set the block's status word");
  setStatus->add_option("VALUE", *value, "The new status word")->required();
  setStatus->callback([value, exitCode] {
    DWORD number = 0;
    if (!ParseDword(value->c_str(), &number)) {
      std::fprintf(stderr, "set-status: %s is not a number\n", value->c_str());
      *exitCode = 2;
      return;
    }
    *exitCode = SimpleCommand(kCommandSetStatus, number, 1);
  });

  auto reg = std::make_shared<RegistryArgs>();
  CLI::App* regVerb = app.add_subcommand("reg", "Registry access through the service");
  regVerb->require_subcommand(1);
  CLI::App* get = regVerb->add_subcommand("get", "Read a value");
  get->add_option("KEY", reg->key, "ROOT\\PATH (HKCR, HKCU, HKLM, HKU or HKCC)")->required();
  get->add_option("NAME", reg->name, "Value name")->required();
  get->callback([reg, exitCode] { *exitCode = RegistryVerb("get", *reg); });
  CLI::App* set = regVerb->add_subcommand("set", "Write a value");
  set->add_option("KEY", reg->key, "ROOT\\PATH (HKCR, HKCU, HKLM, HKU or HKCC)")->required();
  set->add_option("NAME", reg->name, "Value name")->required();
  set->add_option("TYPE", reg->type, "sz, expand_sz, dword, qword or binary (hex)")->required();
  set->add_option("DATA", reg->data, "The value's data")->required();
  set->callback([reg, exitCode] { *exitCode = RegistryVerb("set", *reg); });

  auto send = std::make_shared<SendArgs>();
  CLI::App* sendVerb = app.add_subcommand("send", "Send a raw request (for tests)");
  sendVerb->add_option("LENGTH COMMAND ARGS", send->words, "LENGTH COMMAND [ARG1 [ARG2 [ARG3]]]")
      ->required()
      ->expected(2, 5);
  sendVerb->add_option("--bytes", send->bytes, "Bytes to send (default LENGTH)")->type_name("N");
  sendVerb->callback([send, exitCode] { *exitCode = SendVerb(*send); });
}
