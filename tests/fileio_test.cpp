// The toolkit's file layer against a model of the bytes a file holds: capped
// whole reads at and around their limits, piecewise reads, appends and the
// kinds of path.
#include "toolkit/fileio.h"

#include <gtest/gtest.h>
#include <sys/socket.h>
#include <sys/un.h>
#include <unistd.h>

#include <cstring>
#include <filesystem>
#include <random>

#include "test_util.h"

namespace {

std::string RandomBytes(std::mt19937& random, std::size_t size) {
    std::string bytes(size, '\0');
    for (char& c : bytes) c = static_cast<char>(random() & 0xff);
    return bytes;
}

TEST(FileIo, CappedAndPiecewiseReadsAndAppendsMatchAModelOfTheFile) {
    const unsigned seed = std::random_device{}();
    SCOPED_TRACE("seed " + std::to_string(seed));
    std::mt19937 random(seed);
    nxtest::TempDir dir;
    const std::string path = dir.File("data");
    // Sizes around the read buffer (64 KiB) and the limits matter most.
    const std::size_t edges[] = {0, 1, 65535, 65536, 65537, 131072};
    for (int round = 0; round < 60; ++round) {
        const std::size_t size = round < 6 ? edges[round] : random() % 200000;
        const std::string content = RandomBytes(random, size);
        ASSERT_TRUE(toolkit::AppendInOneWrite(path, content, true));
        const std::size_t limit = random() % 3 == 0 ? size + (random() % 3) - 1 : random() % 200000;
        std::string bytes = "stale", why;
        const bool fits = size <= limit;
        EXPECT_EQ(toolkit::ReadWholeFile(path, limit, bytes, why), fits) << size << " " << limit;
        EXPECT_EQ(bytes, fits ? content : std::string());
        if (!fits) {
            EXPECT_EQ(why, "larger than " + std::to_string(limit) + " bytes");
        }
        // Piece by piece, each piece of a random length.
        toolkit::File file(path, toolkit::File::Mode::kRead);
        ASSERT_TRUE(file.IsOpen());
        EXPECT_TRUE(file.IsRegular());
        EXPECT_EQ(file.Size(), size);
        std::string pieces;
        for (std::size_t at = 0;;) {
            const std::size_t want = random() % 70000;
            const toolkit::ReadEnd end = toolkit::ReadUpTo(file.Descriptor(), want, pieces);
            const std::size_t got = std::min(want, size - at);
            at += got;
            ASSERT_EQ(pieces.size(), at);
            ASSERT_EQ(
                end, want <= size - (at - got) ? toolkit::ReadEnd::kLimit : toolkit::ReadEnd::kEnd);
            if (end == toolkit::ReadEnd::kEnd) break;
        }
        EXPECT_EQ(pieces, content);
    }
    // Appends, each one write, with now and then a fresh start.
    std::string model;
    for (int step = 0; step < 300; ++step) {
        const bool truncate = random() % 25 == 0;
        const std::string line = RandomBytes(random, random() % 5000);
        ASSERT_TRUE(toolkit::AppendInOneWrite(path, line, truncate));
        model = truncate ? line : model + line;
    }
    std::string bytes, why;
    ASSERT_TRUE(toolkit::ReadWholeFile(path, model.size(), bytes, why)) << why;
    EXPECT_EQ(bytes, model);
}

TEST(FileIo, KindsOfPathAndWhatCannotBeReadOrAppendedTo) {
    nxtest::TempDir dir;
    const std::string file = dir.File("file"), link = dir.File("link"), socket = dir.File("sock");
    ASSERT_TRUE(toolkit::AppendInOneWrite(file, "x"));
    std::filesystem::create_symlink(file, link);
    int fd = ::socket(AF_UNIX, SOCK_STREAM, 0);
    sockaddr_un address{};
    address.sun_family = AF_UNIX;
    std::strcpy(address.sun_path, socket.c_str());
    ASSERT_EQ(::bind(fd, reinterpret_cast<sockaddr*>(&address), sizeof address), 0);
    EXPECT_EQ(toolkit::KindOf(file), toolkit::FileKind::kRegular);
    EXPECT_EQ(toolkit::KindOf(link), toolkit::FileKind::kRegular);
    EXPECT_EQ(toolkit::KindOf(dir.path().string()), toolkit::FileKind::kDirectory);
    EXPECT_EQ(toolkit::KindOf(socket), toolkit::FileKind::kSocket);
    EXPECT_EQ(toolkit::KindOf("/dev/null"), toolkit::FileKind::kOther);
    EXPECT_EQ(toolkit::KindOf(dir.File("none")), toolkit::FileKind::kNone);
    EXPECT_TRUE(toolkit::IsReadableFile(link));
    EXPECT_FALSE(toolkit::IsReadableFile(dir.path().string()));
    ::close(fd);

    std::string bytes = "stale", why;
    for (auto [path, reason] : {std::pair{dir.File("none"), "cannot open: No such file"},
                                std::pair{dir.path().string(), "not a regular file"},
                                std::pair{std::string("/dev/null"), "not a regular file"}}) {
        EXPECT_FALSE(toolkit::ReadWholeFile(path, 100, bytes, why)) << path;
        EXPECT_EQ(why.rfind(reason, 0), 0u) << why;
        EXPECT_TRUE(bytes.empty());
    }
    // Devices may be read when asked for; a directory never is.
    EXPECT_TRUE(toolkit::ReadWholeFile("/dev/null", 100, bytes, why, false));
    EXPECT_FALSE(toolkit::ReadWholeFile(dir.path().string(), 100, bytes, why, false));
    EXPECT_EQ(why.rfind("cannot read: ", 0), 0u) << why;
    // An append never follows a link in the last component.
    EXPECT_FALSE(toolkit::AppendInOneWrite(link, "y"));
    EXPECT_EQ(errno, ELOOP);
    // A file whose name is gone says so while it is still open.
    toolkit::File open(file, toolkit::File::Mode::kRead);
    EXPECT_TRUE(open.StillNamed());
    std::filesystem::remove(file);
    EXPECT_FALSE(open.StillNamed());
}

}  // namespace
