// System message texts, the command line and its splitting, and the
// executable's path, as the service prints and installs them.
#include <gtest/gtest.h>
#include <unistd.h>

#include <climits>
#include <filesystem>
#include <fstream>
#include <iterator>
#include <regex>
#include <string>
#include <vector>

#include "platform/wide.h"
#include "platform/win32.h"

namespace {

std::string SystemText(DWORD code) {
  LPWSTR text = nullptr;
  DWORD length = FormatMessageW(
      FORMAT_MESSAGE_ALLOCATE_BUFFER | FORMAT_MESSAGE_FROM_SYSTEM | FORMAT_MESSAGE_IGNORE_INSERTS,
      nullptr, code, MAKELANGID(LANG_NEUTRAL, SUBLANG_DEFAULT), reinterpret_cast<LPWSTR>(&text), 0,
      nullptr);
  if (length == 0) return "<none>";
  std::string result = WideToUtf8(WideView(text, length));
  LocalFree(text);
  return result;
}

std::string Executable() {
  char exe[PATH_MAX];
  ssize_t length = readlink("/proc/self/exe", exe, sizeof exe - 1);
  return length > 0 ? std::string(exe, static_cast<std::size_t>(length)) : std::string();
}

// Every error code the emulation declares has its system text, so no error
// it reports prints as an empty message; texts are Windows' own. (The
// service's error-text tests cover unknown codes and short buffers.)
TEST(SystemMessages, EveryDeclaredErrorCodeHasItsText) {
  std::regex declaration(R"(constexpr DWORD (ERROR_\w+) = (\d+);)");
  int checked = 0;
  for (const auto& entry : std::filesystem::directory_iterator(SKYVANE_EMULATION_HEADERS)) {
    std::string name = entry.path().filename().string();
    if (name.rfind("win32_", 0) != 0 || entry.path().extension() != ".h") continue;
    std::ifstream header(entry.path());
    std::string text((std::istreambuf_iterator<char>(header)), std::istreambuf_iterator<char>());
    for (auto it = std::sregex_iterator(text.begin(), text.end(), declaration);
         it != std::sregex_iterator(); ++it) {
      std::string message = SystemText(static_cast<DWORD>(std::stoul((*it)[2])));
      EXPECT_TRUE(message.size() > 2 && message.substr(message.size() - 2) == "\r\n")
          << (*it)[1] << " in " << name << ": " << message;
      ++checked;
    }
  }
  EXPECT_GT(checked, 60);
  EXPECT_EQ(SystemText(1063),
            "The service process could not connect to the service controller.\r\n");
}

std::vector<std::string> Split(const char16_t* line) {
  int count = -1;
  LPWSTR* vector = CommandLineToArgvW(line, &count);
  if (vector == nullptr) return {"<null>"};
  std::vector<std::string> result;
  for (int i = 0; i < count; ++i) result.push_back(WideToUtf8(vector[i]));
  EXPECT_EQ(vector[count], nullptr);
  LocalFree(vector);
  return result;
}

using Args = std::vector<std::string>;

TEST(CommandLine, SplitsByTheWindowsRules) {
  const struct {
    const char16_t* line;
    Args args;
  } rows[] = {
      {u"svc.exe -install", {"svc.exe", "-install"}},
      {u"\"C:\\Program Files\\Sky\\svc.exe\" -debug  \tx",
       {"C:\\Program Files\\Sky\\svc.exe", "-debug", "x"}},
      {u"C:\\dir\\\"x y", {"C:\\dir\\\"x", "y"}},  // the program name knows no backslash rules
      {u"p \"a b\" c", {"p", "a b", "c"}},
      {u"p a\\\\b", {"p", "a\\\\b"}},         // backslashes alone are literal
      {u"p a\\\"b", {"p", "a\"b"}},           // \" is a quote
      {u"p a\\\\\\\"b", {"p", "a\\\"b"}},     // \\\" is \ and a quote
      {u"p \"a\\\\\" b", {"p", "a\\", "b"}},  // \\" is \ and a closing quote
      {u"p a\\\\\\\\\"b c\"", {"p", "a\\\\b c"}},
      {u"p \"\" x", {"p", "", "x"}},
      {u"p \"a\"\"b\"", {"p", "a\"b"}},  // "" inside quotes
      {u"p \"\"\"\"", {"p", "\""}},
      {u"p a\"b c\"d e", {"p", "ab cd", "e"}},
      {u"p x   ", {"p", "x"}},
      {u" p", {"", "p"}},
      {u"", {Executable()}},  // an empty line: the executable alone
  };
  for (const auto& row : rows) EXPECT_EQ(Split(row.line), row.args) << WideToUtf8(row.line);
  int count = 0;
  EXPECT_EQ(CommandLineToArgvW(nullptr, &count), nullptr);
  EXPECT_EQ(GetLastError(), ERROR_INVALID_PARAMETER);
}

TEST(ModuleFileName, ReportsTheExecutable) {
  std::string path = Executable();
  WCHAR buffer[PATH_MAX];
  EXPECT_EQ(GetModuleFileNameW(nullptr, buffer, PATH_MAX), static_cast<DWORD>(path.size()));
  EXPECT_EQ(WideToUtf8(buffer), path);
}

}  // namespace
