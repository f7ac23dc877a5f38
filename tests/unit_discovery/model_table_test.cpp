// The model table lookup and the ASCII widening. The two model lists are
// pinned through the channel scan and the counted drives.
#include "discovery/model_table.h"

#include <gtest/gtest.h>

#include "platform/wide.h"

namespace {

TEST(ModelTableTest, CodesAndInstanceIdsSelectTheirRows) {
  // Bare codes match inside suffixes, the first row winning; instance IDs in
  // any case; a text of five units holds no suffix.
  const struct {
    const WCHAR* text;
    const char* suffix;
  } rows[] = {{WSTR("5E24"), "_5E24"},
              {WSTR(""), "_2A30"},
              {WSTR("9"), "_2A39"},
              {WSTR("HID\\VID_1A2B&PID_3C13&MI_01\\7&2&0&0000"), "_3C13"},
              {WSTR("usb\\vid_1a2b&pid_7b45"), "_7B45"},
              {WSTR("_5E2X"), "none"}};
  for (const auto& row : rows) {
    ModelRow found{WSTR("none"), 7, 7, nullptr};
    LookupModelRow(row.text, &found);
    EXPECT_EQ(WideToUtf8(WideView(found.suffix, WideLength(found.suffix))), row.suffix);
    if (std::string(row.suffix) == "none") {
      EXPECT_EQ(found.flags, 7u) << "untouched";
    }
  }
  ModelRow row{};
  ASSERT_TRUE(LookupModelRow(WSTR("7B45"), &row));
  EXPECT_EQ(row.flags, 0x30u);
  EXPECT_EQ(row.gaugeSegments, 6u);
  EXPECT_FALSE(LookupModelRow(WSTR("ZZZZZ"), &row));
}

TEST(ModelTableTest, CopyAsciiToWideStopsAtEachLimitAndSignExtends) {
  WCHAR out[8];
  const BYTE text[] = "ABCDEFGHIJ";
  EXPECT_EQ(CopyAsciiToWide(out, 5, text, 16), 4u);  // capacity - 1
  EXPECT_EQ(WideToUtf8(WideView(out, WideLength(out))), "ABCD");
  EXPECT_EQ(CopyAsciiToWide(out, 8, text, 3), 3u);  // maxChars
  const BYTE stops[] = {'X', 'Y', 0, 'Z'};
  EXPECT_EQ(CopyAsciiToWide(out, 8, stops, 4), 2u);  // the terminator
  const BYTE high[] = {0x80, 0xFF, 0x7F, 0};
  ASSERT_EQ(CopyAsciiToWide(out, 8, high, 8), 3u);
  EXPECT_EQ(out[0], 0xFF80);
  EXPECT_EQ(out[1], 0xFFFF);
  EXPECT_EQ(out[2], 0x007F);
  EXPECT_EQ(out[3], 0);
}

}  // namespace
