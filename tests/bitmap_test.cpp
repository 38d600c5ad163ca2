#include "toolkit/bitmap.h"

#include <gtest/gtest.h>

#include <filesystem>

#include "test_util.h"

namespace {

TEST(Bitmap, PngRoundTripKeepsEightBitColoursAndTransparency) {
    nxtest::TempDir dir;
    Bitmap bitmap(Size_t<short>(3, 2));
    bitmap.Erase(Color(0xFFFF, 0x8000, 0x0000));
    bitmap.SetPixel(2, 1, Color(0x1234, 0xABCD, 0xFFFF));
    std::string path = dir.File("rgb.png");
    ASSERT_TRUE(bitmap.WritePNG(path));

    Bitmap back;
    ASSERT_TRUE(Bitmap::ReadPNG(path, back));
    ASSERT_EQ(back.GetSizePixel(), Size_t<short>(3, 2));
    // PNG keeps the high byte of each channel; reading widens by 257.
    EXPECT_EQ(back.GetPixel(0, 0), Color(0xFFFF, 0x8080, 0x0000));
    EXPECT_EQ(back.GetPixel(2, 1), Color(0x1212, 0xABAB, 0xFFFF));
    EXPECT_FALSE(back.HasTransparency());

    bitmap.SetTransparent(0, 1);
    ASSERT_TRUE(bitmap.WritePNG(path));
    ASSERT_TRUE(Bitmap::ReadPNG(path, back));
    EXPECT_TRUE(back.IsTransparent(0, 1));
    EXPECT_FALSE(back.IsTransparent(1, 1));
}

TEST(Bitmap, BadSizesAndFailedWritesLeaveNothingBehind) {
    nxtest::TempDir dir;
    EXPECT_TRUE(Bitmap(-3, 5).IsEmpty());
    EXPECT_EQ(Bitmap(100000, 1).GetWidth(), Bitmap::kMaxSide);
    EXPECT_FALSE(Bitmap().WritePNG(dir.File("empty.png")));

    Bitmap bitmap(2, 2);
    bitmap.SetPixel(-1, 0, Color(1, 2, 3));  // ignored, no crash
    bitmap.SetPixel(2, 0, Color(1, 2, 3));
    EXPECT_EQ(bitmap.GetPixel(5, 5), Color());
    EXPECT_FALSE(bitmap.WritePNG(dir.File("missing/dir/x.png")));
    EXPECT_TRUE(std::filesystem::is_empty(dir.path()));

    nxtest::WriteFile(dir.File("junk.png"), "\x89PNG\r\n\x1a\nnot really");
    Bitmap kept(1, 1);
    EXPECT_FALSE(Bitmap::ReadPNG(dir.File("junk.png"), kept));
    EXPECT_EQ(kept.GetWidth(), 1);
}

}  // namespace
