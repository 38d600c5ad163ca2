#include "nxbase/mymemblo.h"

#include <gtest/gtest.h>

#include <climits>
#include <cstdint>
#include <cstring>
#include <random>
#include <sstream>
#include <string>
#include <vector>

namespace {

using Bytes = std::vector<unsigned char>;

Bytes Image(const MyMemoryBlock& block) {
    const auto* p = reinterpret_cast<const unsigned char*>(block.GetDatenZeiger());
    return Bytes(p, p + block.Len());
}

MyMemoryBlock BlockOf(const Bytes& bytes) {
    MyMemoryBlock block;
    block.Put(bytes.data(), static_cast<long>(bytes.size()));
    return block;
}

TEST(MyMemoryBlock, WritesEveryTypeAsItsLittleEndianImage) {
    MyMemoryBlock block;
    FlagSet flags(3);
    flags.SetFlag(1);
    std::stringstream stream("hi");
    block << 'A' << static_cast<unsigned char>(0xFF) << static_cast<short>(-2)
          << static_cast<unsigned short>(0x1234) << 1 << 0x12345678 << -123456789L
          << 0x100000005L  // a long beyond 32 bits keeps its low 32
          << String("abc") << String() << "xy" << flags << FlagSet() << stream;
    const Bytes expected = {
        0x41,                                      // 'A'
        0xFF,                                      // unsigned char 255
        0xFE, 0xFF,                                // short -2
        0x34, 0x12,                                // unsigned short 0x1234
        0x01, 0x00, 0x00, 0x00,                    // int 1
        0x78, 0x56, 0x34, 0x12,                    // int 0x12345678
        0xEB, 0x32, 0xA4, 0xF8,                    // long -123456789 = 0xF8A432EB
        0x05, 0x00, 0x00, 0x00,                    // long 0x1'00000005
        0x61, 0x62, 0x63, 0x00,                    // String "abc" with its zero
        0x00,                                      // empty String: the zero alone
        0x78, 0x79,                                // const char* "xy": no zero
        0x03, 0x00, 0x00, 0x00, 0x00, 0x01, 0x00,  // 3 flags, flag 1 set
        0x00, 0x00, 0x00, 0x00,                    // empty FlagSet: count only
        0x02, 0x00, 0x00, 0x00, 0x68, 0x69,        // stream "hi"
    };
    EXPECT_EQ(Image(block), expected);
    EXPECT_EQ(stream.tellg(), 0) << "writing a stream must not move its read position";
}

TEST(MyMemoryBlock, ReadsBackEveryTypeInWritingOrder) {
    FlagSet wide(130);
    for (int i : {0, 63, 64, 65, 129}) wide.SetFlag(i);
    const String longText(std::string(String::kMaxLen, 'q'));
    MyMemoryBlock block(1);
    block << CHAR_MIN << static_cast<char>(-7) << static_cast<unsigned char>(200)
          << static_cast<short>(SHRT_MIN) << static_cast<unsigned short>(USHRT_MAX) << INT_MIN
          << INT_MAX << -1L << String("Grün") << String() << longText << wide << FlagSet(0)
          << String("after");

    int minChar = 0;
    char c = 0;
    unsigned char uc = 0;
    short s = 0;
    unsigned short us = 0;
    int i1 = 0, i2 = 0;
    long l = 0;
    String text, empty("x"), longRead, after;
    FlagSet readWide, readEmpty(5);
    block >> minChar >> c >> uc >> s >> us >> i1 >> i2 >> l >> text >> empty >> longRead >>
        readWide >> readEmpty >> after;
    // Writing the values read gives the same image (the writer's bytes are
    // pinned by the test above), so every value came back exactly.
    MyMemoryBlock again;
    again << minChar << c << uc << s << us << i1 << i2 << l << text << empty << longRead << readWide
          << readEmpty << after;
    EXPECT_EQ(Image(again), Image(block));
    EXPECT_EQ(l, -1L) << "a long is written as its low 32 bits, so sign extension is checked here";
    EXPECT_EQ(block.Remaining(), 0);
    EXPECT_FALSE(block.ReadPastEnd());
}

TEST(MyMemoryBlock, GrowsByDoublingAndRebasesPositions) {
    MyMemoryBlock block;
    std::vector<char> bytes(1025);
    for (std::size_t i = 0; i < bytes.size(); ++i) bytes[i] = static_cast<char>(i * 7);
    EXPECT_EQ(block.Put(bytes.data(), 1024), 1024);
    EXPECT_EQ(block.Capacity(), 1024);
    char first[10];
    block.Get(first, 10);
    block.RememberReadPointer();
    block.RememberWritePointer();
    EXPECT_EQ(block.Put(bytes.data() + 1024, 1), 1);
    EXPECT_EQ(block.Capacity(), 2048);
    EXPECT_EQ(block.GetGetPointer(), block.GetDatenZeiger() + 10);
    EXPECT_EQ(std::memcmp(block.GetDatenZeiger(), bytes.data(), 1025), 0);

    // From one byte through twenty doublings, one int at a time.
    MyMemoryBlock small(1);
    constexpr int kValues = 1 << 18;
    for (int v = 0; v < kValues; ++v) small << v;
    EXPECT_EQ(small.Len(), 4 * kValues);
    EXPECT_EQ(small.Capacity(), 4 * kValues) << "capacity 1 doubled up to exactly 2^20";
    int value = -1;
    bool allEqual = true;
    for (int v = 0; v < kValues; ++v) {
        small >> value;
        allEqual = allEqual && value == v;
    }
    EXPECT_TRUE(allEqual);

    // A block grown while it is being read keeps its read and remembered positions.
    block.RestoreReadPointer();
    EXPECT_EQ(block.GetGetPointer(), block.GetDatenZeiger() + 10);
    block.Put(bytes.data(), 1025);
    block.Put(bytes.data(), 1025);
    EXPECT_EQ(block.Capacity(), 4096);
    block.RestoreReadPointer();
    EXPECT_EQ(block.GetGetPointer(), block.GetDatenZeiger() + 10);
}

TEST(MyMemoryBlock, ZeroCapacityAndAppendingFromItselfWork) {
    MyMemoryBlock block(0);
    EXPECT_EQ(block.Put("abcd", 0), 0);
    EXPECT_EQ(block.Len(), 0);
    block << String("ab");
    EXPECT_EQ(block.Capacity(), 4);
    // The source lies inside the block that grows under it.
    EXPECT_EQ(block.Put(block.GetDatenZeiger(), 3), 3);
    EXPECT_EQ(Image(block), (Bytes{'a', 'b', 0, 'a', 'b', 0}));
    EXPECT_EQ(block.Capacity(), 8);
}

TEST(MyMemoryBlock, MinimizeGivesBackSlackAndKeepsReading) {
    MyMemoryBlock block;
    block << 7 << String("kept") << 9;
    int seven = 0;
    block >> seven;
    block.RememberReadPointer();
    block.Minimize();
    EXPECT_EQ(block.Capacity(), 13);
    EXPECT_EQ(block.Len(), 13);
    String kept;
    int nine = 0;
    block >> kept >> nine;
    EXPECT_EQ(kept, "kept");
    EXPECT_EQ(nine, 9);
    block.RestoreReadPointer();
    EXPECT_EQ(block.GetGetPointer(), block.GetDatenZeiger() + 4);
    block << 'x';  // growth from an exact fit doubles
    EXPECT_EQ(block.Capacity(), 26);

    MyMemoryBlock empty;
    empty.Minimize();
    EXPECT_EQ(empty.Capacity(), 0);
    empty << 1;
    EXPECT_EQ(empty.Len(), 4);
}

TEST(MyMemoryBlock, CopyReadsFromItsStartAndForgetsRememberedPositions) {
    MyMemoryBlock source(64);
    source << 1 << 2 << 3;
    int value = 0;
    source >> value;
    source.RememberReadPointer();
    source >> value;

    MyMemoryBlock copy(source);
    EXPECT_EQ(Image(copy), Image(source));
    copy >> value;
    EXPECT_EQ(value, 1) << "a copy reads from its beginning";
    copy.RestoreReadPointer();
    EXPECT_EQ(copy.GetGetPointer(), copy.GetDatenZeiger()) << "remembered positions are not copied";

    MyMemoryBlock assigned;
    assigned << String("old content");
    assigned = source;
    EXPECT_EQ(Image(assigned), Image(source));
    assigned >> value;
    EXPECT_EQ(value, 1);

    MyMemoryBlock& alias = assigned;
    assigned = alias;
    EXPECT_EQ(assigned.Len(), 12);
    EXPECT_EQ(assigned.GetGetPointer(), assigned.GetDatenZeiger() + 4)
        << "self-assignment changes nothing";

    source >> value;
    EXPECT_EQ(value, 3) << "the source keeps its own read position";
}

TEST(MyMemoryBlock, RestoringTheWritePositionRewritesFromThere) {
    MyMemoryBlock block;
    block << 1;
    block.RememberWritePointer();
    block << 2 << 3;
    int value = 0;
    block >> value >> value >> value;
    block.RestoreWritePointer();
    EXPECT_EQ(block.Len(), 4);
    EXPECT_EQ(block.GetGetPointer(), block.GetPutPointer());
    block << 42;
    EXPECT_EQ(Image(block), (Bytes{1, 0, 0, 0, 42, 0, 0, 0}));
}

TEST(MyMemoryBlock, ReadingPastTheEndStopsAtTheWrittenData) {
    // Get returns the shorter count and leaves the rest of the target alone.
    MyMemoryBlock block = BlockOf({1, 2, 3});
    unsigned char target[5] = {9, 9, 9, 9, 9};
    EXPECT_EQ(block.Get(target, 5), 3);
    EXPECT_EQ(Bytes(target, target + 5), (Bytes{1, 2, 3, 9, 9}));
    EXPECT_TRUE(block.ReadPastEnd());
    EXPECT_EQ(block.Get(target, 1), 0);

    // A truncated int replaces only the low bytes it found.
    MyMemoryBlock truncated = BlockOf({0xAA, 0xBB});
    int value = 0x11223344;
    truncated >> value;
    EXPECT_EQ(value, 0x1122BBAA);
    EXPECT_TRUE(truncated.ReadPastEnd());
    truncated.ClearReadError();
    short s = 5;
    truncated >> s;
    EXPECT_EQ(s, 5);
    EXPECT_TRUE(truncated.ReadPastEnd());

    // A String without a zero byte takes the rest, and no more.
    MyMemoryBlock unterminated = BlockOf({'a', 'b', 'c'});
    String text;
    unterminated >> text;
    EXPECT_EQ(text, "abc");
    EXPECT_EQ(unterminated.Remaining(), 0);
    EXPECT_TRUE(unterminated.ReadPastEnd());

    // A text beyond the String limit is cut, and the reader still lands
    // after its zero byte.
    MyMemoryBlock overlong;
    const std::string run(70000, 'q');
    overlong.Put(run.data(), static_cast<long>(run.size()));
    overlong << String() << 7;
    int seven = 0;
    overlong >> text >> seven;
    EXPECT_EQ(text.Len(), String::kMaxLen);
    EXPECT_EQ(seven, 7);
    EXPECT_FALSE(overlong.ReadPastEnd());

    // A flag count beyond the data, below zero or huge leaves the target alone.
    FlagSet flags(2);
    flags.SetFlag(0);
    const FlagSet original = flags;
    for (const Bytes& bad : {Bytes{5, 0, 0, 0, 1, 1}, Bytes{0xFF, 0xFF, 0xFF, 0xFF, 1},
                             Bytes{0xFF, 0xFF, 0xFF, 0x7F}}) {
        MyMemoryBlock block = BlockOf(bad);
        block >> flags;
        EXPECT_EQ(flags, original);
        EXPECT_TRUE(block.ReadPastEnd());
    }
}

TEST(FlagSet, SetOperatorsWorkAcrossWordsAndCounts) {
    FlagSet a(70), b(3);
    a.SetFlag(2);
    a.SetFlag(69);
    b.SetFlag(0);
    b.SetFlag(2);
    EXPECT_EQ((a | b).CountSet(), 3);
    EXPECT_EQ((a | b).Count(), 70);
    EXPECT_EQ((a & b).CountSet(), 1);
    EXPECT_EQ((a - b).GetFlag(2), 0);
    EXPECT_EQ((a - b).GetFlag(69), 1);
    EXPECT_EQ((a ^ b).CountSet(), 2);
    EXPECT_EQ((~a).CountSet(), 68) << "the complement stays inside the count";
    FlagSet full(70);
    full.SetAll();
    EXPECT_EQ(full.CountSet(), 70);

    a.SetFlag(70);
    a.SetFlag(-1);
    EXPECT_EQ(a.GetFlag(70), 0);
    EXPECT_EQ(a.GetFlag(-1), 0);
    EXPECT_EQ(a.CountSet(), 2);
    EXPECT_NE(a, FlagSet(70));
    a.ClearAll();
    EXPECT_EQ(a, FlagSet(70));
}

TEST(MyMemoryBlock, ASignedCharIsOneByteLikeAChar) {
    MyMemoryBlock block;
    block << static_cast<signed char>(-2) << static_cast<signed char>(1);
    EXPECT_EQ(Image(block), (Bytes{0xFE, 0x01}));
    signed char first = 0, second = 0;
    block >> first >> second;
    EXPECT_EQ(first, -2);
    EXPECT_EQ(second, 1);
}

TEST(FlagSet, TwoIntsAreARangeThatSerialisesByIndexAndReadsBackFromZero) {
    FlagSet messages(-2, 135);
    EXPECT_EQ(messages.Count(), 137);
    EXPECT_EQ(messages.Low(), -2);
    EXPECT_EQ(messages.High(), 135);
    for (int flag : {-2, -1, 0, 134}) messages.SetFlag(flag);
    messages.SetFlag(-3);   // below the range
    messages.SetFlag(135);  // the end is not a flag
    EXPECT_EQ(messages.CountSet(), 4);
    EXPECT_EQ(messages.GetFlag(-2), 1);
    EXPECT_EQ(messages.GetFlag(1), 0);
    EXPECT_EQ(messages.GetFlag(135), 0);
    EXPECT_EQ(FlagSet(0, 3).Count(), 3);
    EXPECT_EQ(FlagSet(5, 5).Count(), 0);
    EXPECT_EQ(FlagSet(5, 2).Count(), 0);
    EXPECT_EQ(FlagSet(INT_MAX, INT_MIN).Count(), 0) << "no overflow in the width";

    // Index order on the wire: flag -2 is the first byte, 134 the last.
    MyMemoryBlock block;
    block << messages;
    Bytes bytes = Image(block);
    ASSERT_EQ(bytes.size(), 4u + 137u);
    EXPECT_EQ(bytes[0], 137);
    EXPECT_EQ(bytes[4], 1);        // -2
    EXPECT_EQ(bytes[5], 1);        // -1
    EXPECT_EQ(bytes[6], 1);        // 0
    EXPECT_EQ(bytes[7], 0);        // 1
    EXPECT_EQ(bytes[4 + 136], 1);  // 134
    FlagSet back;
    block >> back;
    EXPECT_EQ(back.Low(), 0);
    EXPECT_EQ(back.Count(), 137);
    for (int i = 0; i < 137; ++i) EXPECT_EQ(back.GetFlag(i), messages.GetFlag(i - 2)) << i;
}

// Random runs of writes into blocks of random first sizes (so that growth
// falls anywhere, also inside a text), shrunk, copied and moved between
// writes, against bytes laid out by hand. Under the address sanitizer a word
// stored past the storage shows too.
TEST(MyMemoryBlock, WritesAgreeWithAHandMadeImageOverRandomRuns) {
    const unsigned seed = std::random_device{}();
    SCOPED_TRACE("seed " + std::to_string(seed));
    std::mt19937 random(seed);
    auto put = [](Bytes& model, std::uint32_t value, int size) {
        for (int i = 0; i < size; ++i)
            model.push_back(static_cast<unsigned char>(value >> (8 * i)));
    };
    for (int run = 0; run < 300; ++run) {
        MyMemoryBlock block(static_cast<long>(random() % 40));
        Bytes model;
        for (int step = random() % 60; step > 0; --step) {
            const std::uint32_t value = random();
            switch (random() % 8) {
                case 0:
                    block << static_cast<char>(value);
                    put(model, value, 1);
                    break;
                case 1:
                    block << static_cast<unsigned char>(value);
                    put(model, value, 1);
                    break;
                case 2:
                    block << static_cast<short>(value);
                    put(model, value, 2);
                    break;
                case 3:
                    block << static_cast<int>(value);
                    put(model, value, 4);
                    break;
                case 4:
                    block << static_cast<long>(static_cast<std::int32_t>(value));
                    put(model, value, 4);
                    break;
                case 6:
                    block.Minimize();
                    break;
                case 7:
                    block = MyMemoryBlock(block);
                    break;
                default: {
                    // Distinct characters: a piece copied to the wrong place shows.
                    std::string text(random() % 40, ' ');
                    for (std::size_t i = 0; i < text.size(); ++i)
                        text[i] = static_cast<char>('a' + (value + i) % 26);
                    // Now and then a short text in a heap buffer that held a
                    // longer one (the 16-byte copy reads its storage).
                    String written(value % 3 == 0 ? text + std::string(20, '-') : text);
                    written.Erase(static_cast<xub_StrLen>(text.size()));
                    block << written;
                    model.insert(model.end(), text.begin(), text.end());
                    model.push_back(0);
                }
            }
        }
        ASSERT_EQ(Image(block), model) << "run " << run;
    }
}

}  // namespace
