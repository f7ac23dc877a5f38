// The model table, the two model lists and the ASCII widening.
#include "discovery/model_table.h"

#include <gtest/gtest.h>

#include "platform/wide.h"

namespace {

std::string SuffixOf(const WCHAR* text) {
  ModelRow row{};
  if (!LookupModelRow(text, &row)) return "none";
  return WideToUtf8(WideView(row.suffix, WideLength(row.suffix)));
}

TEST(ModelTableTest, BareCodesAndInstanceIdsSelectTheirRows) {
  EXPECT_EQ(SuffixOf(WSTR("5E24")), "_5E24");
  EXPECT_EQ(SuffixOf(WSTR("")), "_2A30");  // an empty code selects the first row
  EXPECT_EQ(SuffixOf(WSTR("7B44")), "_7B44");
  EXPECT_EQ(SuffixOf(WSTR("USB\\VID_1A2B&PID_7B45&MI_00\\6&1&0&0000")), "_7B45");
  EXPECT_EQ(SuffixOf(WSTR("HID\\VID_1A2B&PID_3C13&MI_01\\7&2&0&0000")), "_3C13");
  EXPECT_EQ(SuffixOf(WSTR("_5E2X")), "none");  // five units: a text that holds no suffix
  EXPECT_EQ(SuffixOf(WSTR("usb\\vid_1a2b&pid_7b45")), "_7B45");  // paths: any case
  EXPECT_EQ(SuffixOf(WSTR("9")), "_2A39");  // bare codes match inside suffixes, first row wins

  ModelRow row{};
  ASSERT_TRUE(LookupModelRow(WSTR("7B45"), &row));
  EXPECT_EQ(row.flags, 0x30u);
  EXPECT_EQ(row.gaugeSegments, 6u);
  EXPECT_EQ(row.productLine, nullptr);
  ASSERT_TRUE(LookupModelRow(WSTR("3C12"), &row));
  EXPECT_EQ(WideToUtf8(WideView(row.productLine, WideLength(row.productLine))), "Rambler");
  EXPECT_EQ(row.gaugeSegments, 4u);

  ModelRow untouched{WSTR("keep"), 7, 7, nullptr};
  EXPECT_FALSE(LookupModelRow(WSTR("ZZZZZ"), &untouched));
  EXPECT_EQ(untouched.flags, 7u);
}

TEST(ModelTableTest, ChannelAndStandaloneLists) {
  EXPECT_TRUE(IsChannelModel(WSTR("HID\\VID_1A2B&PID_3C13&MI_01\\7&2&0&0000")));  // contains "C13"
  EXPECT_FALSE(IsStandaloneChannelModel(WSTR("HID\\VID_1A2B&PID_3C13&MI_01\\7&2&0&0000")));
  EXPECT_TRUE(IsChannelModel(WSTR("1394\\QX&QUARRY\\0030E00000045D6F")));
  EXPECT_TRUE(IsChannelModel(WSTR("1394\\QX______&EXTERNAL_HDD\\1")));
  EXPECT_TRUE(IsChannelModel(WSTR("USB\\VID_1A2B&PID_7B43")));
  EXPECT_FALSE(IsChannelModel(WSTR("USB\\VID_1A2B&PID_2A31\\5")));
  EXPECT_FALSE(IsChannelModel(WSTR("1394\\QX&SOMETHING\\1")));
  EXPECT_FALSE(IsChannelModel(WSTR("")));
  EXPECT_TRUE(IsStandaloneChannelModel(WSTR("HID\\VID_1A2B&PID_5E24")));
  EXPECT_TRUE(IsStandaloneChannelModel(WSTR("PID_7B45")));
  EXPECT_FALSE(IsStandaloneChannelModel(WSTR("PID_7B43")));
  EXPECT_FALSE(IsStandaloneChannelModel(WSTR("pid_7b44")));  // case-sensitive
}

TEST(ModelTableTest, CopyAsciiToWideStopsAtEachLimitAndSignExtends) {
  WCHAR out[8];
  const BYTE text[] = "ABCDEFGHIJ";
  EXPECT_EQ(CopyAsciiToWide(out, 5, text, 16), 4u);  // capacity - 1
  EXPECT_EQ(WideToUtf8(WideView(out, WideLength(out))), "ABCD");
  EXPECT_EQ(CopyAsciiToWide(out, 8, text, 3), 3u);  // maxChars
  EXPECT_EQ(WideToUtf8(WideView(out, WideLength(out))), "ABC");
  const BYTE stops[] = {'X', 'Y', 0, 'Z'};
  EXPECT_EQ(CopyAsciiToWide(out, 8, stops, 4), 2u);  // the terminator
  const BYTE empty[] = {0, 'A'};
  out[0] = WSTR('?');
  EXPECT_EQ(CopyAsciiToWide(out, 8, empty, 2), 0u);
  EXPECT_EQ(out[0], 0);
  const BYTE high[] = {0x80, 0xFF, 0x7F, 0};
  ASSERT_EQ(CopyAsciiToWide(out, 8, high, 8), 3u);
  EXPECT_EQ(out[0], 0xFF80);
  EXPECT_EQ(out[1], 0xFFFF);
  EXPECT_EQ(out[2], 0x007F);
  EXPECT_EQ(out[3], 0);
}

}  // namespace
