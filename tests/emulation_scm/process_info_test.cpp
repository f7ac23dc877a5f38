// System message texts, the command line and its splitting, and the
// executable's path.
#include <gtest/gtest.h>
#include <sys/wait.h>
#include <unistd.h>

#include <climits>
#include <cstdlib>
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

TEST(SystemMessages, TextsAsWindowsGivesThem) {
  EXPECT_EQ(SystemText(1073), "The specified service already exists.\r\n");
  EXPECT_EQ(SystemText(2), "The system cannot find the file specified.\r\n");
  EXPECT_EQ(SystemText(5), "Access is denied.\r\n");
  EXPECT_EQ(SystemText(87), "The parameter is incorrect.\r\n");
  EXPECT_EQ(SystemText(1063),
            "The service process could not connect to the service controller.\r\n");
  EXPECT_EQ(SystemText(1060), "The specified service does not exist as an installed service.\r\n");
  EXPECT_EQ(SystemText(1062), "The service has not been started.\r\n");

  SetLastError(0);
  EXPECT_EQ(SystemText(0xDEADBEEF), "<none>");
  EXPECT_EQ(GetLastError(), ERROR_MR_MID_NOT_FOUND);

  // Into the caller's buffer: it must hold the terminator too.
  WCHAR buffer[64];
  DWORD length = FormatMessageW(FORMAT_MESSAGE_FROM_SYSTEM | FORMAT_MESSAGE_IGNORE_INSERTS, nullptr,
                                5, 0, buffer, 64, nullptr);
  EXPECT_EQ(length, 19u);
  EXPECT_EQ(WideToUtf8(buffer), "Access is denied.\r\n");
  EXPECT_EQ(FormatMessageW(FORMAT_MESSAGE_FROM_SYSTEM | FORMAT_MESSAGE_IGNORE_INSERTS, nullptr, 5,
                           0, buffer, 19, nullptr),
            0u);
  EXPECT_EQ(GetLastError(), ERROR_INSUFFICIENT_BUFFER);
}

// Every error code the emulation declares has its system text, so no error
// it reports prints as an empty message.
TEST(SystemMessages, EveryDeclaredErrorCodeHasAText) {
  std::regex declaration(R"(constexpr DWORD (ERROR_\w+) = (\d+);)");
  int checked = 0;
  for (const auto& entry : std::filesystem::directory_iterator(SKYVANE_EMULATION_HEADERS)) {
    std::string name = entry.path().filename().string();
    if (name.rfind("win32_", 0) != 0 || entry.path().extension() != ".h") continue;
    std::ifstream header(entry.path());
    std::string text((std::istreambuf_iterator<char>(header)), std::istreambuf_iterator<char>());
    for (auto it = std::sregex_iterator(text.begin(), text.end(), declaration);
         it != std::sregex_iterator(); ++it) {
      DWORD code = static_cast<DWORD>(std::stoul((*it)[2]));
      std::string message = SystemText(code);
      EXPECT_NE(message, "<none>") << (*it)[1] << " (" << code << ") in " << name;
      EXPECT_TRUE(message.size() > 2 && message.substr(message.size() - 2) == "\r\n") << (*it)[1];
      ++checked;
    }
  }
  EXPECT_GT(checked, 60);
}

std::vector<std::string> Split(const char16_t* line) {
  int count = -1;
  LPWSTR* vector = CommandLineToArgvW(line, &count);
  std::vector<std::string> result;
  if (vector == nullptr) return {"<null>"};
  for (int i = 0; i < count; ++i) result.push_back(WideToUtf8(vector[i]));
  EXPECT_EQ(vector[count], nullptr);
  LocalFree(vector);
  return result;
}

using Args = std::vector<std::string>;

TEST(CommandLine, SplitsByTheWindowsRules) {
  EXPECT_EQ(Split(u"svc.exe -install"), (Args{"svc.exe", "-install"}));
  EXPECT_EQ(Split(u"\"C:\\Program Files\\Sky\\svc.exe\" -debug  \tx"),
            (Args{"C:\\Program Files\\Sky\\svc.exe", "-debug", "x"}));
  // The program name knows no backslash rules.
  EXPECT_EQ(Split(u"C:\\dir\\\"x y"), (Args{"C:\\dir\\\"x", "y"}));
  EXPECT_EQ(Split(u"p \"a b\" c"), (Args{"p", "a b", "c"}));
  EXPECT_EQ(Split(u"p a\\\\b"), (Args{"p", "a\\\\b"}));         // backslashes alone are literal
  EXPECT_EQ(Split(u"p a\\\"b"), (Args{"p", "a\"b"}));           // \" is a quote
  EXPECT_EQ(Split(u"p a\\\\\\\"b"), (Args{"p", "a\\\"b"}));     // \\\" is \ and a quote
  EXPECT_EQ(Split(u"p \"a\\\\\" b"), (Args{"p", "a\\", "b"}));  // \\" is \ and a closing quote
  EXPECT_EQ(Split(u"p a\\\\\\\\\"b c\""), (Args{"p", "a\\\\b c"}));
  EXPECT_EQ(Split(u"p \"\" x"), (Args{"p", "", "x"}));
  EXPECT_EQ(Split(u"p \"a\"\"b\""), (Args{"p", "a\"b"}));  // "" inside quotes
  EXPECT_EQ(Split(u"p \"\"\"\""), (Args{"p", "\""}));
  EXPECT_EQ(Split(u"p a\"b c\"d e"), (Args{"p", "ab cd", "e"}));
  EXPECT_EQ(Split(u"p x   "), (Args{"p", "x"}));
  EXPECT_EQ(Split(u" p"), (Args{"", "p"}));

  // An empty line gives the executable's path alone.
  char exe[PATH_MAX];
  ssize_t length = readlink("/proc/self/exe", exe, sizeof exe - 1);
  ASSERT_GT(length, 0);
  EXPECT_EQ(Split(u""), (Args{std::string(exe, static_cast<std::size_t>(length))}));

  int count = 0;
  EXPECT_EQ(CommandLineToArgvW(nullptr, &count), nullptr);
  EXPECT_EQ(GetLastError(), ERROR_INVALID_PARAMETER);
}

std::vector<std::string> OwnArguments() {
  std::ifstream file("/proc/self/cmdline", std::ios::binary);
  std::string raw((std::istreambuf_iterator<char>(file)), std::istreambuf_iterator<char>());
  std::vector<std::string> arguments;
  std::size_t start = 0;
  while (start < raw.size()) {
    std::size_t end = raw.find('\0', start);
    arguments.push_back(raw.substr(start, end - start));
    start = end + 1;
  }
  return arguments;
}

// Run in a child started with awkward arguments (below): the command line,
// split again, gives back exactly the arguments the process got.
TEST(CommandLine, DISABLED_RoundTripChild) {
  EXPECT_EQ(Split(GetCommandLineW()), OwnArguments());
  EXPECT_EQ(GetCommandLineW(), GetCommandLineW());  // one line for the process
}

TEST(CommandLine, GetCommandLineRoundTripsAwkwardArguments) {
  EXPECT_EQ(Split(GetCommandLineW()), OwnArguments());
  pid_t pid = fork();
  ASSERT_GE(pid, 0);
  if (pid == 0) {
    const char* arguments[] = {"/proc/self/exe",
                               "--gtest_filter=CommandLine.DISABLED_RoundTripChild",
                               "--gtest_also_run_disabled_tests",
                               "two words",
                               "",
                               "quote\"inside",
                               "trailing\\",
                               "dir with space\\",
                               "\\\\server\\share",
                               "tab\there",
                               "\xC3\xA9t\xC3\xA9",
                               nullptr};
    execv("/proc/self/exe", const_cast<char* const*>(arguments));
    _exit(127);
  }
  int status = 0;
  ASSERT_EQ(waitpid(pid, &status, 0), pid);
  ASSERT_TRUE(WIFEXITED(status));
  EXPECT_EQ(WEXITSTATUS(status), 0);
}

TEST(ModuleFileName, ReportsTheExecutableAndTruncatesLikeWindows) {
  char exe[PATH_MAX];
  ssize_t length = readlink("/proc/self/exe", exe, sizeof exe - 1);
  ASSERT_GT(length, 4);
  std::string path(exe, static_cast<std::size_t>(length));

  WCHAR buffer[PATH_MAX];
  DWORD got = GetModuleFileNameW(nullptr, buffer, PATH_MAX);
  EXPECT_EQ(got, static_cast<DWORD>(path.size()));
  EXPECT_EQ(WideToUtf8(buffer), path);

  // Too small: cut, terminated, the buffer size returned.
  SetLastError(0);
  got = GetModuleFileNameW(nullptr, buffer, 4);
  EXPECT_EQ(got, 4u);
  EXPECT_EQ(GetLastError(), ERROR_INSUFFICIENT_BUFFER);
  EXPECT_EQ(WideToUtf8(buffer), path.substr(0, 3));
  // Exactly the length without room for the terminator is too small too.
  got = GetModuleFileNameW(nullptr, buffer, static_cast<DWORD>(path.size()));
  EXPECT_EQ(got, static_cast<DWORD>(path.size()));
  EXPECT_EQ(GetLastError(), ERROR_INSUFFICIENT_BUFFER);
}

}  // namespace
