#include <gtest/gtest.h>

#include <utility>
#include <vector>

#include "platform/wide.h"
#include "service/service_host.h"

namespace {

Verb Parse(std::vector<WideString> words) {
  std::vector<LPWSTR> argv;
  for (WideString& word : words) argv.push_back(word.data());
  argv.push_back(nullptr);
  return ParseVerb(static_cast<int>(words.size()), argv.data());
}

// A verb is the first argument, "-" or "/" and the whole word in any case;
// anything else falls through to the dispatcher.
TEST(Verbs, OnlyAWholePrefixedFirstWordIsAVerb) {
  const std::pair<std::vector<WideString>, Verb> cases[] = {
      {{WSTR("-install")}, Verb::Install},
      {{WSTR("/INSTALL")}, Verb::Install},
      {{WSTR("/Remove")}, Verb::Remove},
      {{WSTR("-DeBuG"), WSTR("extra")}, Verb::Debug},
      {{}, Verb::None},
      {{WSTR("install")}, Verb::None},
      {{WSTR("-inst")}, Verb::None},
      {{WSTR("--install")}, Verb::None},
      {{WSTR("-installx")}, Verb::None},
      {{WSTR("-")}, Verb::None},
      {{WSTR("")}, Verb::None},
      {{WSTR("x"), WSTR("-install")}, Verb::None},
  };
  for (const auto& [words, verb] : cases) {
    std::vector<WideString> argv{WSTR("SkyvaneSvc")};
    argv.insert(argv.end(), words.begin(), words.end());
    EXPECT_EQ(Parse(argv), verb) << words.size();
  }
}

}  // namespace
