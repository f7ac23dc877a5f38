#include <gtest/gtest.h>

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

TEST(Verbs, PrefixedWordsInAnyCaseAreVerbs) {
  EXPECT_EQ(Parse({WSTR("SkyvaneSvc"), WSTR("-install")}), Verb::Install);
  EXPECT_EQ(Parse({WSTR("SkyvaneSvc"), WSTR("/INSTALL")}), Verb::Install);
  EXPECT_EQ(Parse({WSTR("SkyvaneSvc"), WSTR("/Remove")}), Verb::Remove);
  EXPECT_EQ(Parse({WSTR("SkyvaneSvc"), WSTR("-DeBuG"), WSTR("extra")}), Verb::Debug);
}

TEST(Verbs, AnythingElseFallsThroughToTheDispatcher) {
  EXPECT_EQ(Parse({WSTR("SkyvaneSvc")}), Verb::None);
  EXPECT_EQ(Parse({WSTR("SkyvaneSvc"), WSTR("install")}), Verb::None);
  EXPECT_EQ(Parse({WSTR("SkyvaneSvc"), WSTR("-inst")}), Verb::None);
  EXPECT_EQ(Parse({WSTR("SkyvaneSvc"), WSTR("--install")}), Verb::None);
  EXPECT_EQ(Parse({WSTR("SkyvaneSvc"), WSTR("-installx")}), Verb::None);
  EXPECT_EQ(Parse({WSTR("SkyvaneSvc"), WSTR("-")}), Verb::None);
  EXPECT_EQ(Parse({WSTR("SkyvaneSvc"), WSTR("")}), Verb::None);
  // Only the first argument counts.
  EXPECT_EQ(Parse({WSTR("SkyvaneSvc"), WSTR("x"), WSTR("-install")}), Verb::None);
}

}  // namespace
