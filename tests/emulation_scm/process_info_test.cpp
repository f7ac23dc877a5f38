// The command line and its splitting, and the executable's path, as the
// service's debug verb and install read them. (The system texts the service
// prints are checked by its error-text and verb tests.)
#include <gtest/gtest.h>
#include <unistd.h>

#include <climits>
#include <string>
#include <vector>

#include "platform/wide.h"
#include "platform/win32.h"

namespace {

std::string Executable() {
  char exe[PATH_MAX];
  ssize_t length = readlink("/proc/self/exe", exe, sizeof exe - 1);
  return length > 0 ? std::string(exe, static_cast<std::size_t>(length)) : std::string();
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
