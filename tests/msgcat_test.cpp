// The message catalogue, the byte stuffing (whole, in pieces, in a poke)
// and the application table.
#include "nxbase/msgcat.h"

#include <gtest/gtest.h>

#include <algorithm>
#include <cstring>
#include <random>
#include <string>
#include <vector>

#include "nxbase/dde.h"
#include "nxbase/mymemblo.h"
#include "nxbase/poapps.h"
#include "nxbase/registry.h"
#include "test_util.h"

namespace {

TEST(MessageCatalogue, EveryNameAndItsAnswerMapBackToTheirNumbers) {
    for (int n = 0; n < ANZAHL_BOTSCHAFTEN; ++n) {
        const char* field = PO_BotschaftenNamen[n];
        ASSERT_GT(std::strlen(field), 0u) << n;
        ASSERT_LT(std::strlen(field), static_cast<std::size_t>(kBotschaftNameWidth)) << n;
        // The rest of the 30-byte field is zero.
        for (std::size_t i = std::strlen(field); i < kBotschaftNameWidth; ++i) {
            ASSERT_EQ(field[i], '\0') << n;
        }
        EXPECT_EQ(nxbase::NumberOfCommandText(field), n) << field;
        EXPECT_EQ(nxbase::NumberOfCommandText(std::string("ANSWER!") + field), 1000 + n) << field;
        EXPECT_EQ(nxbase::CommandTextOfNumber(1000 + n), std::string("ANSWER!") + field);
    }
    EXPECT_STREQ(PO_BotschaftenNamen[ANZAHL_BOTSCHAFTEN], "ANZAHL_BOTSCHAFTEN");
    EXPECT_EQ(nxbase::NumberOfCommandText("CONNECT"), CONNECT);
    EXPECT_EQ(nxbase::NumberOfCommandText("GET_ACTIVE_FILTERS"), 134);
    EXPECT_EQ(nxbase::NumberOfCommandText("MESSUNG_AUSGELOEST"), 43);
    EXPECT_EQ(nxbase::NumberOfCommandText("ANZAHL_BOTSCHAFTEN"), -1);
    EXPECT_EQ(nxbase::NumberOfCommandText("ANSWER!LOCK"), 1002);
    EXPECT_EQ(nxbase::NumberOfCommandText("ANSWER!NO_SUCH"), -1);
    EXPECT_EQ(nxbase::NumberOfCommandText("connect"), -1);
    EXPECT_EQ(nxbase::NumberOfCommandText(""), -1);
    EXPECT_EQ(nxbase::CommandTextOfNumber(135), "");
    EXPECT_EQ(nxbase::CommandTextOfNumber(-1), "");
    EXPECT_STREQ(nxbase::MessageName(GET_DEVICE_TYPE), "GET_DEVICE_TYPE");
}

TEST(MessageCatalogue, ByteStuffingRemovesZeroBytesAndComesBack) {
    struct Case {
        std::string plain, encoded;
    };
    const Case cases[] = {
        {std::string("\x00\x01\x02", 3), std::string("\x01\x0A\x01\x01\x02", 5)},
        {"", ""},
        {"abc\xFF", "abc\xFF"},
        {std::string("\x01\x0A", 2), std::string("\x01\x01\x0A", 3)},
    };
    for (const Case& c : cases) {
        EXPECT_EQ(nxbase::EncodeBytes(c.plain.data(), c.plain.size()), c.encoded);
        EXPECT_EQ(nxbase::DecodeBytes(c.encoded.data(), c.encoded.size()), c.plain);
    }
    EXPECT_EQ(nxbase::EncodeBytes(nullptr, 0), "");  // the data of an emptied block
    EXPECT_EQ(nxbase::DecodeBytes("\x01\x05", 2), "\x01");
    EXPECT_EQ(nxbase::DecodeBytes("a\x01", 2), "a\x01");  // a lone 0x01 at the end

    // In place on a block, every byte value.
    MyMemoryBlock block;
    for (int byte = 0; byte < 256; ++byte) block << static_cast<unsigned char>(byte);
    nxbase::EncodeBlock(block);
    EXPECT_EQ(block.Len(), 258);
    EXPECT_EQ(std::memchr(block.GetDatenZeiger(), 0, static_cast<std::size_t>(block.Len())),
              nullptr);
    nxbase::DecodeBlock(block);
    ASSERT_EQ(block.Len(), 256);
    for (int byte = 0; byte < 256; ++byte) {
        unsigned char value = 0;
        block >> value;
        ASSERT_EQ(value, byte);
    }
}

// The decoding as a reader of the stuffing rules would write it, whole.
std::string ModelDecode(const std::string& stuffed) {
    std::string plain;
    for (std::size_t i = 0; i < stuffed.size(); ++i) {
        if (stuffed[i] != '\x01') {
            plain += stuffed[i];
        } else {
            plain += i + 1 < stuffed.size() && stuffed[i + 1] == '\x0A' ? '\x00' : '\x01';
            ++i;
        }
    }
    return plain;
}

TEST(MessageCatalogue, StuffedDataDecodesAlikeInAnyPiecesAndAPokeSplitsAsAWhole) {
    const unsigned seed = std::random_device{}();
    SCOPED_TRACE("seed " + std::to_string(seed));
    std::mt19937 random(seed);
    const char kTricky[] = {'\x00', '\x01', '\x0A', ':', 'a'};
    for (int round = 0; round < 2000; ++round) {
        std::string data(random() % 300, '\0');
        for (char& c : data)
            c = random() % 2 ? kTricky[random() % 5] : static_cast<char>(random() % 256);
        // Random cuts, so that escapes and the ":" fall on the edges.
        std::vector<std::size_t> cuts{0, data.size()};
        for (unsigned n = random() % 6; n > 0; --n) cuts.push_back(random() % (data.size() + 1));
        std::sort(cuts.begin(), cuts.end());
        std::string decoded, work = data;
        nxbase::StuffedDecoder decoder;
        nxbase::PokeSplitter splitter(random() % 2 ? data.size() : 0);
        std::string pieces = data;
        for (std::size_t i = 1; i < cuts.size(); ++i) {
            char* piece = work.data() + cuts[i - 1];
            decoded.append(piece, decoder.Decode(piece, cuts[i] - cuts[i - 1]));
            splitter.Take(pieces.data() + cuts[i - 1], cuts[i] - cuts[i - 1]);
        }
        if (decoder.EndsWithLoneEscape()) decoded += '\x01';
        ASSERT_EQ(decoded, ModelDecode(data));
        ASSERT_EQ(nxbase::DecodeBytes(data.data(), data.size()), decoded);
        std::string plain = data.substr(0, random() % (data.size() + 1));
        ASSERT_EQ(ModelDecode(nxbase::EncodeBytes(plain.data(), plain.size())), plain);
        plain.erase(std::remove(plain.begin(), plain.end(), '\0'), plain.end());  // one kind left
        ASSERT_EQ(ModelDecode(nxbase::EncodeBytes(plain.data(), plain.size())), plain);

        std::string sender;
        MyMemoryBlock block;
        splitter.Finish(sender, block);
        const std::size_t colon = data.find(':');
        ASSERT_EQ(sender, colon == std::string::npos ? "" : data.substr(0, colon));
        ASSERT_EQ(std::string(block.GetDatenZeiger(), static_cast<std::size_t>(block.Len())),
                  ModelDecode(colon == std::string::npos ? data : data.substr(colon + 1)));
    }
}

class ApplicationTable : public ::testing::Test {
  protected:
    void Register(const std::string& path, const std::string& executable,
                  const std::string& version) {
        const char* key = "Software\\K-Lume\\LumaServer";
        RegistryHandler::AddRegistryEntry(RegistryEntry(HKEY_LOCAL_MACHINE, key, "Path"), path);
        RegistryHandler::AddRegistryEntry(RegistryEntry(HKEY_LOCAL_MACHINE, key, "Executable"),
                                          executable);
        RegistryHandler::AddRegistryEntry(RegistryEntry(HKEY_LOCAL_MACHINE, key, "Version"),
                                          version);
    }
    void AddPeer(const std::string& id, const std::string& path) {
        RegistryHandler::AddRegistryEntry(
            RegistryEntry(HKEY_LOCAL_MACHINE, "Software\\K-Lume\\ChromaLink\\Applications", id),
            path);
    }
    std::string Error(const std::string& ownName) {
        try {
            PostOfficeApplications table(ownName);
        } catch (const std::runtime_error& error) {
            return error.what();
        }
        return "no error";
    }

    nxtest::TempDir dir;
    nxtest::ScopedEnv machine{"NXBASE_MACHINE_REGISTRY", dir.File("machine.sqlite")};
    nxtest::ScopedEnv log{"NXBASE_LOG_PATH", dir.path().string()};
};

TEST_F(ApplicationTable, TheServerCheckAndTheVersionRule) {
    EXPECT_EQ(Error("ColorLab"), "LumaServer missing or old!");
    Register("/opt/k-lume/bin", "/opt/k-lume/bin/lumaserver", "2.9");
    EXPECT_EQ(Error("ColorLab"), "Old LumaServer found! Please reinstall new LumaServer.");
    Register("/opt/k-lume/bin", "/opt/k-lume/bin/lumaserver", "three");
    EXPECT_EQ(Error("ColorLab"), "Unknown LumaServer version! Please reinstall LumaServer");
    for (const char* version : {"3", "3.0", "10.2"}) {
        Register("/opt/k-lume/bin", "/opt/k-lume/bin/lumaserver", version);
        EXPECT_EQ(Error("ColorLab"), "no error") << version;
    }
    // The server itself reads nothing, whatever the registry holds.
    Register("", "", "1.0");
    for (const char* own : {"LumaServer", "lumaserver", "LPMSERV"}) {
        PostOfficeApplications table(own);
        EXPECT_EQ(table.GetApplicationCount(), 0u) << own;
    }
}

TEST_F(ApplicationTable, PeersWithTheirPathsAndMissingExecutablesSkipped) {
    Register("/opt/k-lume/bin", "/opt/k-lume/bin/lumaserver", "3.0");
    nxtest::WriteFile(dir.File("ColorLab.exe"), "");
    nxtest::WriteFile(dir.File("kxprint"), "");
    AddPeer("ColorLab", dir.File("ColorLab.exe"));
    AddPeer("Printer", dir.File("kxprint"));
    AddPeer("Gone", dir.File("gone"));
    AddPeer("Empty", "");
    PostOfficeApplications table("Tester");
    EXPECT_EQ(table.GetApplications(),
              (std::vector<std::string>{"ColorLab", "LumaServer", "Printer"}));
    PostOfficeApplication server = table.GetApplicationInfo("LumaServer");
    EXPECT_EQ(server.GetName(), "lumaserver");
    EXPECT_EQ(server.GetExecutable(), "lumaserver");
    EXPECT_EQ(server.GetPath(), "/opt/k-lume/bin");
    EXPECT_EQ(server.GetExecutableWithPath(), "/opt/k-lume/bin/lumaserver");
    PostOfficeApplication lab = table.GetApplicationInfo("ColorLab");
    EXPECT_EQ(lab.GetName(), "ColorLab");
    EXPECT_EQ(lab.GetExecutable(), "ColorLab.exe");
    EXPECT_EQ(lab.GetPath(), dir.path().string());
    EXPECT_FALSE(table.GetApplication("Gone"));
    EXPECT_THROW(table.GetApplicationInfo("Gone"), std::runtime_error);

    // Windows paths split at "\" as well; a path without a file name is illegal.
    PostOfficeApplication windows("W", "C:\\K-Lume\\bin.v2\\KXALWIN.EXE");
    EXPECT_EQ(windows.GetPath(), "C:\\K-Lume\\bin.v2");
    EXPECT_EQ(windows.GetName(), "KXALWIN");
    for (const char* illegal : {"lumaserver", "/opt/k-lume/bin/", ""}) {
        try {
            PostOfficeApplication bad("B", illegal);
            ADD_FAILURE() << "accepted " << illegal;
        } catch (const std::runtime_error& error) {
            EXPECT_EQ(std::string(error.what()), std::string("Illegal path: ") + illegal);
        }
    }
}

}  // namespace
