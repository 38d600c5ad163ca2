#include "nxbase/registry.h"

#include <gtest/gtest.h>
#include <unistd.h>

#include <chrono>
#include <filesystem>
#include <thread>

#include "nxbase/logfile.h"
#include "test_util.h"
#include "toolkit/string.h"

namespace {

using nxbase::RegistryHive;
using nxbase::RegistryStore;
using nxbase::RegistryValue;

constexpr const char* kRoot = "Software\\K-Lume\\RegistryTest";

class RegistryTest : public ::testing::Test {
  protected:
    void SetUp() override { RegistryHandler::SetRootPath(kRoot); }
    void TearDown() override { RegistryHandler::SetRootPath(""); }

    nxtest::TempDir dir;
    nxtest::ScopedEnv user{"NXBASE_USER_REGISTRY", dir.File("user/registry.sqlite")};
    nxtest::ScopedEnv machine{"NXBASE_MACHINE_REGISTRY", dir.File("machine/registry.sqlite")};
};

TEST_F(RegistryTest, UserValueWinsOverMachineValueWhichWinsOverDefault) {
    EXPECT_EQ(RegistryHandler::GetValue("Server", "Port", "default"), "default");
    EXPECT_EQ(RegistryHandler::GetValue("Server", "Port"), "");

    ASSERT_TRUE(RegistryHandler::AddRegistryEntry(HKEY_LOCAL_MACHINE, "Server", "Port", "4000"));
    EXPECT_EQ(RegistryHandler::GetValue("Server", "Port", "default"), "4000");

    RegistryEntry entry = RegistryEntry::CreateUserRegistryEntry("Server", "Port");
    ASSERT_TRUE(RegistryHandler::AddRegistryEntry(entry, "5000"));
    EXPECT_EQ(RegistryHandler::GetValue("Server", "Port", "default"), "5000");
    EXPECT_EQ(RegistryHandler::GetValue(HKEY_LOCAL_MACHINE, "Server", "Port"), "4000");

    // The machine entry sits in the machine's file only.
    RegistryEntry app = RegistryEntry::CreateAppRegistryEntry("Server", "Port");
    EXPECT_EQ(RegistryHandler::GetRegistryEntry(app), "4000");
    EXPECT_TRUE(std::filesystem::exists(dir.File("machine/registry.sqlite")));
}

TEST_F(RegistryTest, KeyPathsAndValueNamesIgnoreCaseAndKeepTheirCase) {
    RegistryHandler::AddRegistryEntry(HKEY_CURRENT_USER, "Colour\\Display", "GammaValue", "2.2");
    EXPECT_EQ(RegistryHandler::GetValue(HKEY_CURRENT_USER, "COLOUR\\display", "gammavalue"), "2.2");
    EXPECT_EQ(RegistryHandler::GetValue(HKEY_CURRENT_USER, "\\colour\\\\Display\\", "GAMMAVALUE"),
              "2.2");

    // Writing under another case replaces the value and keeps the first name.
    RegistryHandler::AddRegistryEntry(HKEY_CURRENT_USER, "colour\\DISPLAY", "GAMMAVALUE", "1.8");
    std::map<std::string, std::string> values =
        RegistryHandler::GetKeys(HKEY_CURRENT_USER, "Colour\\Display");
    EXPECT_EQ(values, (std::map<std::string, std::string>{{"GammaValue", "1.8"}}));
    EXPECT_EQ(RegistryHandler::GetKeyCount(HKEY_CURRENT_USER, "colour\\display"), 1u);

    EXPECT_EQ(RegistryStore::SubKeys(RegistryHive::CurrentUser, "SOFTWARE\\k-lume\\registrytest"),
              (std::vector<std::string>{"Colour"}));
    EXPECT_EQ(
        RegistryStore::Tree(RegistryHive::CurrentUser, "software\\k-lume\\REGISTRYTEST\\colour"),
        (std::vector<std::string>{std::string(kRoot) + "\\Colour",
                                  std::string(kRoot) + "\\Colour\\Display"}));

    // A sibling whose name extends the key's is not below it.
    RegistryHandler::AddRegistryEntry(HKEY_CURRENT_USER, "Colour2", "x", "1");
    RegistryHandler::AddRegistryEntry(HKEY_CURRENT_USER, "Colour-B", "x", "1");
    EXPECT_EQ(
        RegistryStore::Tree(RegistryHive::CurrentUser, std::string(kRoot) + "\\Colour").size(), 2u);
    EXPECT_EQ(RegistryHandler::GetKeyCount(HKEY_CURRENT_USER, "Missing"), 0u);
    EXPECT_TRUE(RegistryHandler::GetKeys(HKEY_CURRENT_USER, "Missing").empty());
}

TEST_F(RegistryTest, DeletesOnlyInsideTheMakersBranches) {
    RegistryHandler::AddRegistryEntry(HKEY_CURRENT_USER, "Group\\Sub", "a", "1");
    RegistryHandler::AddRegistryEntry(HKEY_CURRENT_USER, "Group", "b", "2");
    NxWriteRegistryKeyString("HKEY_CURRENT_USER\\Software\\Other\\Group", "c", "3");
    NxWriteRegistryKeyString("HKEY_CURRENT_USER\\software\\veltramond\\Old", "d", "4");

    EXPECT_FALSE(RegistryHandler::DeleteGroup(
        RegistryEntry(HKEY_CURRENT_USER, "Software\\Other\\Group", "")));
    EXPECT_FALSE(RegistryHandler::DeleteKey(
        RegistryEntry(HKEY_CURRENT_USER, "Software\\Other\\Group", "c")));
    EXPECT_EQ(NxReadRegistryKeyString("HKEY_CURRENT_USER\\Software\\Other\\Group", "c"), "3");

    EXPECT_TRUE(RegistryHandler::DeleteKey(
        RegistryEntry(HKEY_CURRENT_USER, "Software\\VeltraMond\\Old", "D")));
    EXPECT_EQ(NxReadRegistryKeyString("HKEY_CURRENT_USER\\software\\veltramond\\Old", "d"), "");

    EXPECT_TRUE(RegistryHandler::DeleteGroup(HKEY_CURRENT_USER, "group"));
    EXPECT_FALSE(
        RegistryStore::KeyExists(RegistryHive::CurrentUser, std::string(kRoot) + "\\Group"));
    EXPECT_FALSE(
        RegistryStore::KeyExists(RegistryHive::CurrentUser, std::string(kRoot) + "\\Group\\Sub"));
    EXPECT_FALSE(RegistryHandler::DeleteGroup(HKEY_CURRENT_USER, "group"));
    EXPECT_THROW(RegistryStore::DeleteKey(RegistryHive::CurrentUser, "\\"), std::invalid_argument);
}

TEST_F(RegistryTest, ReadingADwordAsAStringRaisesTheKeyTypeError) {
    RegistryStore::Write(RegistryHive::CurrentUser, std::string(kRoot) + "\\Numbers",
                         RegistryValue::Dword("Count", 10));
    const std::string path = "HKEY_CURRENT_USER\\" + std::string(kRoot) + "\\Numbers";
    EXPECT_THROW(NxReadRegistryKeyString(path, "Count"), nxbase::RegistryKeyTypeError);
    EXPECT_THROW(NxReadRegistryKeysString(path), nxbase::RegistryKeyTypeError);
    EXPECT_THROW(RegistryHandler::GetValue("Numbers", "Count"), nxbase::RegistryKeyTypeError);
    EXPECT_THROW(RegistryHandler::GetKeys(HKEY_CURRENT_USER, "Numbers"),
                 nxbase::RegistryKeyTypeError);
    EXPECT_EQ(RegistryHandler::GetKeyCount(HKEY_CURRENT_USER, "Numbers"), 1u);
    EXPECT_EQ(
        RegistryStore::Read(RegistryHive::CurrentUser, std::string(kRoot) + "\\Numbers", "count")
            ->dword,
        10u);

    // A string written over it changes its type.
    NxWriteRegistryKeyString(path, "Count", "eleven");
    EXPECT_EQ(NxReadRegistryKeyString(path, "COUNT"), "eleven");
}

TEST_F(RegistryTest, EntriesNeedTheRootPath) {
    RegistryHandler::SetRootPath("");
    try {
        RegistryEntry::CreateUserRegistryEntry("Log", "Startup");
        FAIL() << "no exception";
    } catch (const std::logic_error& error) {
        EXPECT_STREQ(error.what(), "Registry root path not set");
    }
    EXPECT_THROW(RegistryEntry::CreateAppRegistryEntry("Log", "Startup"), std::logic_error);
    EXPECT_TRUE(nxbase::ReadLogOptionsFromRegistry().empty());
}

TEST_F(RegistryTest, FullPathsCreateKeysOnReadingAndIgnoreOtherHives) {
    const std::string path = "HKEY_CURRENT_USER\\Software\\K-Lume\\Fresh";
    EXPECT_FALSE(RegistryStore::KeyExists(RegistryHive::CurrentUser, "Software\\K-Lume\\Fresh"));
    EXPECT_FALSE(std::filesystem::exists(dir.File("user/registry.sqlite")));
    EXPECT_EQ(NxReadRegistryKeyString(path, "Missing"), "");
    EXPECT_TRUE(RegistryStore::KeyExists(RegistryHive::CurrentUser, "software\\k-lume\\fresh"));
    EXPECT_TRUE(RegistryStore::KeyExists(RegistryHive::CurrentUser, "Software"));

    EXPECT_TRUE(NxWriteRegistryKeyString(path, "Name", "value with \"quotes\""));
    EXPECT_EQ(NxReadRegistryKeyString(path, "name"), "value with \"quotes\"");
    EXPECT_EQ(NxReadRegistryKeysString(path),
              (std::map<std::string, std::string>{{"Name", "value with \"quotes\""}}));

    EXPECT_EQ(NxReadRegistryKeyString("HKEY_CLASSES_ROOT\\x", "y"), "");
    EXPECT_TRUE(NxReadRegistryKeysString("HKCU\\Software").empty());
    EXPECT_FALSE(NxWriteRegistryKeyString("HKEY_USERS\\x", "y", "z"));
    EXPECT_FALSE(std::filesystem::exists(dir.File("machine/registry.sqlite")));
}

TEST_F(RegistryTest, TwoProcessesWritingOneHiveLoseNoKey) {
    constexpr int kProcesses = 2;
    constexpr int kKeysEach = 1000;
    constexpr int kMachineEvery = 10;
    // The parent holds an open connection across fork().
    RegistryStore::Write(RegistryHive::CurrentUser, "Software\\K-Lume",
                         RegistryValue::Text("x", "1"));
    pid_t children[kProcesses];
    for (int p = 0; p < kProcesses; ++p) {
        children[p] = nxtest::Fork([&] {
            for (int i = 0; i < kKeysEach; ++i) {
                std::string key =
                    "Software\\K-Lume\\P" + std::to_string(p) + "\\K" + std::to_string(i);
                RegistryStore::Write(RegistryHive::CurrentUser, key,
                                     RegistryValue::Text("V", std::to_string(i)));
                // The machine's hive does not exist yet: both create it.
                if (i % kMachineEvery == 0)
                    RegistryStore::Write(RegistryHive::LocalMachine, key,
                                         RegistryValue::Dword("V", i));
            }
            return 0;
        });
    }
    for (pid_t child : children) EXPECT_EQ(nxtest::WaitExit(child), 0);
    for (int p = 0; p < kProcesses; ++p) {
        std::string parent = "Software\\K-Lume\\P" + std::to_string(p);
        ASSERT_EQ(RegistryStore::SubKeys(RegistryHive::CurrentUser, parent).size(),
                  static_cast<std::size_t>(kKeysEach));
        for (int i = 0; i < kKeysEach; ++i) {
            auto value = RegistryStore::Read(RegistryHive::CurrentUser,
                                             parent + "\\K" + std::to_string(i), "V");
            ASSERT_TRUE(value) << parent << " K" << i;
            EXPECT_EQ(value->text, std::to_string(i));
            if (i % kMachineEvery == 0) {
                auto machineValue = RegistryStore::Read(RegistryHive::LocalMachine,
                                                        parent + "\\K" + std::to_string(i), "V");
                ASSERT_TRUE(machineValue) << parent << " K" << i;
                EXPECT_EQ(machineValue->dword, static_cast<std::uint32_t>(i));
            }
        }
    }
}

TEST_F(RegistryTest, ProcessesCreatingOneFreshHiveAtOnceAllSucceed) {
    // Four processes race to create each of many fresh hives; every one must
    // see a registry database, never a half-made file. The pause between
    // seeing the fresh file and creating its tables makes every round a race:
    // without the transaction around both, all four would create the tables.
    constexpr int kRounds = 20;
    constexpr int kProcesses = 4;
    nxbase::detail::SetSchemaCheckHook(
        [] { std::this_thread::sleep_for(std::chrono::milliseconds(20)); });
    int failures = 0;
    for (int round = 0; round < kRounds && failures == 0; ++round) {
        std::string file = dir.File("race/" + std::to_string(round) + ".sqlite");
        nxtest::ScopedEnv hive("NXBASE_USER_REGISTRY", file);
        pid_t children[kProcesses];
        for (int p = 0; p < kProcesses; ++p) {
            children[p] = nxtest::Fork([&] {
                RegistryStore::Write(RegistryHive::CurrentUser, "Software\\Race",
                                     RegistryValue::Dword("p" + std::to_string(p), 1));
                return 0;
            });
        }
        for (pid_t child : children) failures += nxtest::WaitExit(child) != 0;
        EXPECT_EQ(RegistryStore::Values(RegistryHive::CurrentUser, "Software\\Race").size(),
                  static_cast<std::size_t>(kProcesses));
    }
    nxbase::detail::SetSchemaCheckHook(nullptr);
    EXPECT_EQ(failures, 0);
}

TEST_F(RegistryTest, TheMachineHiveKeepsNoSideFilesAndReadsFromAReadOnlyPlace) {
    std::string file = dir.File("machine/registry.sqlite");
    RegistryStore::Write(RegistryHive::LocalMachine, "Software\\K-Lume\\LumaServer",
                         RegistryValue::Text("Version", "3.0"));
    EXPECT_FALSE(std::filesystem::exists(file + "-wal"));
    EXPECT_FALSE(std::filesystem::exists(file + "-shm"));
    // Another process reads it from a directory and file it cannot write.
    ::chmod(file.c_str(), 0444);
    ::chmod(dir.File("machine").c_str(), 0555);
    ::chmod(dir.path().c_str(), 0755);
    const int code = nxtest::InChild([&] {
        if (!nxtest::DropRoot()) return 3;                // a user without rights
        if (::access(file.c_str(), R_OK) != 0) return 4;  // the build tree is closed to it
        auto value = RegistryStore::Read(RegistryHive::LocalMachine, "Software\\K-Lume\\LumaServer",
                                         "Version");
        return value && value->ToString() == "3.0" ? 0 : 2;
    });
    ::chmod(dir.File("machine").c_str(), 0755);
    if (code == 4) GTEST_SKIP() << "the test directory is not readable by user 65534";
    EXPECT_EQ(code, 0);
}

TEST_F(RegistryTest, ThreadsWritingAndReadingShareNothingButTheFile) {
    constexpr int kThreads = 4;
    constexpr int kWrites = 300;
    std::vector<std::thread> threads;
    std::atomic<int> failures{0};
    for (int t = 0; t < kThreads; ++t) {
        threads.emplace_back([t, &failures] {
            for (int i = 0; i < kWrites; ++i) {
                std::string name = "T" + std::to_string(t) + "_" + std::to_string(i);
                RegistryHandler::AddRegistryEntry(HKEY_CURRENT_USER, "Threads", name, name);
                if (RegistryHandler::GetValue(HKEY_CURRENT_USER, "Threads", name) != name)
                    ++failures;
            }
        });
    }
    for (auto& thread : threads) thread.join();
    EXPECT_EQ(failures, 0);
    EXPECT_EQ(RegistryHandler::GetKeyCount(HKEY_CURRENT_USER, "Threads"),
              static_cast<std::uint32_t>(kThreads * kWrites));
}

TEST_F(RegistryTest, CorruptFileGivesAnErrorNamingItAndStaysUntouched) {
    const std::string file = dir.File("broken.sqlite");
    const std::string junk = std::string(8192, 'x') + "definitely not SQLite";
    nxtest::WriteFile(file, junk);
    nxtest::ScopedEnv broken("NXBASE_USER_REGISTRY", file);
    try {
        RegistryHandler::GetValue(HKEY_CURRENT_USER, "Log", "Startup");
        FAIL() << "no exception";
    } catch (const nxbase::RegistryError& error) {
        EXPECT_THAT(std::string(error.what()), HasSubstr(file)) << error.what();
        EXPECT_THAT(std::string(error.what()), HasSubstr("corrupt")) << error.what();
        EXPECT_EQ(error.GetKind(), nxbase::RegistryErrorKind::kCorrupt);
    }
    EXPECT_THROW(RegistryHandler::AddRegistryEntry(HKEY_CURRENT_USER, "Log", "Startup", "1"),
                 nxbase::RegistryError);
    EXPECT_EQ(nxtest::ReadFile(file), junk);

    // A valid SQLite file of someone else is refused as well.
    const std::string foreign = dir.File("foreign.sqlite");
    nxtest::ScopedEnv other("NXBASE_USER_REGISTRY", foreign);
    ASSERT_EQ(std::system(("sqlite3 '" + foreign + "' 'CREATE TABLE t(a)'").c_str()), 0);
    try {
        RegistryHandler::GetValue(HKEY_CURRENT_USER, "Log", "Startup");
        ADD_FAILURE() << "no exception";
    } catch (const nxbase::RegistryError& error) {
        EXPECT_EQ(error.GetKind(), nxbase::RegistryErrorKind::kCorrupt) << error.what();
    }
}

TEST_F(RegistryTest, Regedit4ExportImportRoundTripKeepsEscapesAndDwords) {
    const std::string key = "Software\\K-Lume\\Trip";
    for (const RegistryValue& value :
         {RegistryValue::Text("Quote\"d", "say \"hi\""),
          RegistryValue::Text("Path", "C:\\Program Files\\K-Lume\\"),
          RegistryValue::Text("Lines", "one\r\ntwo"), RegistryValue::Text("", "unnamed"),
          RegistryValue::Dword("Count", 10), RegistryValue::Dword("Max", 0xFFFFFFFFu)}) {
        RegistryStore::Write(RegistryHive::LocalMachine, key, value);
    }
    RegistryStore::Write(RegistryHive::LocalMachine, key + "\\Empty\\Deeper",
                         RegistryValue::Text("x", ""));

    std::string text = nxbase::ExportRegedit4(RegistryHive::LocalMachine, key);
    EXPECT_THAT(text, HasSubstr("\"Count\"=dword:0000000a\n")) << text;
    EXPECT_THAT(text, HasSubstr("\"Max\"=dword:ffffffff\n")) << text;
    EXPECT_THAT(text, HasSubstr("\"Path\"=\"C:\\\\Program Files\\\\K-Lume\\\\\"\n")) << text;
    EXPECT_THAT(text, HasSubstr("\"Quote\\\"d\"=\"say \\\"hi\\\"\"\n")) << text;
    EXPECT_THAT(text, HasSubstr("@=\"unnamed\"\n")) << text;
    EXPECT_EQ(text.rfind("REGEDIT4\n", 0), 0u);

    ASSERT_TRUE(RegistryStore::DeleteKey(RegistryHive::LocalMachine, key));
    // Windows line ends and a comment are read as well.
    std::string windows;
    for (char c : text) windows += c == '\n' ? std::string("\r\n") : std::string(1, c);
    windows.insert(windows.find("\r\n") + 2, "; saved by the test\r\n");
    RegistryStore::Apply(nxbase::ParseRegedit4(windows, "trip.reg"));
    EXPECT_EQ(nxbase::ExportRegedit4(RegistryHive::LocalMachine, key), text);
    EXPECT_EQ(RegistryStore::Read(RegistryHive::LocalMachine, key, "Lines")->text, "one\r\ntwo");

    // Deletions: a value and a whole key.
    RegistryStore::Apply(
        nxbase::ParseRegedit4("REGEDIT4\n[HKLM\\Software\\K-Lume\\Trip]\n\"Count\"=-\n[-HKEY_LOCAL_"
                              "MACHINE\\Software\\K-Lume\\Trip\\Empty]\n",
                              "delete.reg"));
    EXPECT_FALSE(RegistryStore::Read(RegistryHive::LocalMachine, key, "Count"));
    EXPECT_FALSE(RegistryStore::KeyExists(RegistryHive::LocalMachine, key + "\\Empty"));
}

TEST_F(RegistryTest, Regedit4ErrorsNameSourceAndLineAndApplyNothing) {
    struct Case {
        const char* text;
        const char* expected;
    };
    const Case cases[] = {
        {"", "trip.reg: not REGEDIT4"},
        {"REGEDIT5\n", "trip.reg:1: the first line must be REGEDIT4"},
        {"REGEDIT4\n\"a\"=\"b\"\n", "trip.reg:2: a value outside a section"},
        {"REGEDIT4\n[HKEY_USERS\\x]\n", "trip.reg:2: unknown hive"},
        {"REGEDIT4\n[HKCU\\x\n", "trip.reg:2: a section must end with ]"},
        {"REGEDIT4\n[HKCU\\x]\n\"a\"=dword:123456789\n", "trip.reg:3: a dword needs"},
        {"REGEDIT4\n[HKCU\\x]\n\"a\"=dword:-1\n", "trip.reg:3: a dword needs"},
        {"REGEDIT4\n[HKCU\\x]\n\"a\"=\"b\\q\"\n", "trip.reg:3: unknown escape \\q"},
        {"REGEDIT4\n[HKCU\\x]\n\"a\"=\"b\n", "trip.reg:3: missing closing quote"},
        {"REGEDIT4\n[HKCU\\x]\n\"a\"=\"b\" junk\n", "trip.reg:3: text after the closing quote"},
        {"REGEDIT4\n[HKCU\\x]\n\"a\"=hex:01,0g\n", "trip.reg:3: hex data must be byte pairs"},
        {"REGEDIT4\n[HKCU\\x]\n\"a\"=hex:01,\n", "trip.reg:3: hex data ends with a comma"},
        {"REGEDIT4\n[HKCU\\x]\n\"a\"=hex(z):01\n", "trip.reg:3: hex(N) needs"},
        {"REGEDIT4\n[HKCU\\x]\n\"a\"\n", "trip.reg:3: missing ="},
        {"REGEDIT4\n[-HKCU\\]\n", "trip.reg:2: a whole hive cannot be deleted"},
    };
    auto refusal = [](const std::string& text) {
        try {
            nxbase::ParseRegedit4(text, "trip.reg");
        } catch (const std::runtime_error& error) {
            return std::string(error.what());
        }
        return "accepted: " + text;
    };
    for (const Case& c : cases) {
        const std::string why = refusal(c.text);
        EXPECT_EQ(why.rfind(c.expected, 0), 0u) << why;
    }
    // The offending text is quoted up to 60 characters; "..." only if cut.
    const std::string line(60, 'x'), first = "trip.reg:1: the first line must be REGEDIT4: ";
    EXPECT_EQ(refusal(line + "\n"), first + line);
    EXPECT_EQ(refusal(line + "y\n"), first + line + "...");
    EXPECT_FALSE(std::filesystem::exists(dir.File("user/registry.sqlite")));
}

// The UTF-16LE bytes, with byte-order mark, of what regedit writes by default.
std::string Utf16Le(const std::u16string& text) {
    std::string bytes = "\xFF\xFE";
    for (char16_t unit : text) {
        bytes += static_cast<char>(unit & 0xFF);
        bytes += static_cast<char>(unit >> 8);
    }
    return bytes;
}

TEST_F(RegistryTest, RegeditFiveInUtf16WithHexValuesImportsTypedAndInUtf8) {
    const std::u16string file =
        u"Windows Registry Editor Version 5.00\r\n\r\n"
        u"[HKEY_CURRENT_USER\\Software\\K-Lume\\Gr\u00fc\u00dfe]\r\n"
        u"\"Name\"=\"Wei\u00df \u20ac\"\r\n"
        u"\"Blob\"=hex:00,01,ff\r\n"
        u"\"Expand\"=hex(2):25,00,54,00,45,00,4d,00,50,00,25,00,00,00\r\n"
        u"\"Multi\"=hex(7):61,00,00,00,c4,00,62,00,00,00,\\\r\n"
        u"  00,00\r\n";
    auto changes = nxbase::ParseRegedit4(Utf16Le(file), "v5.reg");
    RegistryStore::Apply(changes);
    const std::string key =
        "Software\\K-Lume\\Gr\xC3\xBC\xC3\x9F"
        "e";  // UTF-8 in the hive
    auto name = RegistryStore::Read(RegistryHive::CurrentUser, key, "Name");
    ASSERT_TRUE(name);
    EXPECT_EQ(name->text, "Wei\xC3\x9F \xE2\x82\xAC");
    auto blob = RegistryStore::Read(RegistryHive::CurrentUser, key, "Blob");
    ASSERT_TRUE(blob);
    EXPECT_EQ(blob->type, nxbase::RegistryType::Binary);
    EXPECT_EQ(blob->text, std::string("\x00\x01\xFF", 3));
    auto expand = RegistryStore::Read(RegistryHive::CurrentUser, key, "Expand");
    ASSERT_TRUE(expand);
    EXPECT_EQ(expand->type, nxbase::RegistryType::ExpandString);
    EXPECT_EQ(expand->text, "%TEMP%");
    auto multi = RegistryStore::Read(RegistryHive::CurrentUser, key, "Multi");
    ASSERT_TRUE(multi);
    EXPECT_EQ(multi->type, nxbase::RegistryType::MultiString);
    EXPECT_EQ(multi->text, std::string("a\0\xC3\x84"
                                       "b\0",
                                       6));

    // The application's ANSI view: Windows-1252 bytes, and the key-type error
    // for the typed values.
    EXPECT_EQ(NxReadRegistryKeyString("HKEY_CURRENT_USER\\Software\\K-Lume\\Gr\xFC\xDF"
                                      "e",
                                      "Name"),
              "Wei\xDF \x80");
    EXPECT_THROW(NxReadRegistryKeyString("HKEY_CURRENT_USER\\Software\\K-Lume\\Gr\xFC\xDF"
                                         "e",
                                         "Multi"),
                 nxbase::RegistryKeyTypeError);

    // Exported and read back: the same typed values.
    std::string exported = nxbase::ExportRegedit4(RegistryHive::CurrentUser, key);
    nxtest::TempDir other;
    nxtest::ScopedEnv otherHive("NXBASE_USER_REGISTRY", other.File("r.sqlite"));
    RegistryStore::Apply(nxbase::ParseRegedit4(exported, "exported.reg"));
    for (const char* value : {"Name", "Blob", "Expand", "Multi"}) {
        auto back = RegistryStore::Read(RegistryHive::CurrentUser, key, value);
        ASSERT_TRUE(back) << value;
        auto original = value == std::string("Name")     ? name
                        : value == std::string("Blob")   ? blob
                        : value == std::string("Expand") ? expand
                                                         : multi;
        EXPECT_EQ(back->type, original->type) << value;
        EXPECT_EQ(back->text, original->text) << value;
    }

    // A name holding a NUL byte is refused with file and line, the byte escaped.
    try {
        std::u16string withNul = u"Windows Registry Editor Version 5.00\r\n[HKCU\\x]\r\n\"a";
        withNul += char16_t(0);
        withNul += u"b\"=\"c\"\r\n";
        nxbase::ParseRegedit4(Utf16Le(withNul), "nul.reg");
        ADD_FAILURE() << "a NUL in a name was accepted";
    } catch (const std::runtime_error& error) {
        EXPECT_EQ(std::string(error.what()),
                  "nul.reg:3: a value name holding a NUL byte: \"a\\x00b\"=\"c\"");
    }
}

TEST_F(RegistryTest, ApplicationStringsReadBackByteForByteAndTheHiveHoldsUtf8) {
    std::string ansi;
    for (int byte = 0x20; byte < 0x100; ++byte) ansi += static_cast<char>(byte);
    ASSERT_TRUE(RegistryHandler::AddRegistryEntry(HKEY_CURRENT_USER, "Texts", "All\xE4", ansi));
    EXPECT_EQ(RegistryHandler::GetValue(HKEY_CURRENT_USER, "Texts", "All\xE4"), ansi);
    auto stored = RegistryStore::Read(RegistryHive::CurrentUser, std::string(kRoot) + "\\Texts",
                                      "All\xC3\xA4");
    ASSERT_TRUE(stored);
    EXPECT_EQ(stored->text, toolkit::Windows1252ToUtf8(ansi));
    EXPECT_EQ(toolkit::Utf8ToWindows1252(stored->text), ansi);
    EXPECT_EQ(toolkit::Utf8ToWindows1252("\xE2\x82\xAC \xE4\xB8\xAD \xFF"), "\x80 ? ?");
}

TEST_F(RegistryTest, LogOptionsInTheUsersHiveReachANewLogFile) {
    nxtest::ScopedEnv logPath("NXBASE_LOG_PATH", dir.path().string());
    nxtest::ScopedEnv logOptions("NXBASE_LOG_OPTIONS", "");
    const std::string log = std::string(kRoot) + "\\Log";
    RegistryStore::Write(RegistryHive::CurrentUser, log, RegistryValue::Text("Startup", "1"));
    RegistryStore::Write(RegistryHive::CurrentUser, log, RegistryValue::Text("Language", "true"));
    RegistryStore::Write(RegistryHive::CurrentUser, log, RegistryValue::Dword("ThreadId", 1));
    RegistryStore::Write(RegistryHive::CurrentUser, log, RegistryValue::Text("Keys", "0"));
    // The machine's hive does not count.
    RegistryStore::Write(RegistryHive::LocalMachine, log, RegistryValue::Text("Locale", "1"));

    EXPECT_EQ(nxbase::ReadLogOptionsFromRegistry(),
              (std::map<std::string, std::string>{
                  {"Keys", "0"}, {"Language", "true"}, {"Startup", "1"}, {"ThreadId", "1"}}));

    LogFile logFile("registry-options");
    EXPECT_TRUE(logFile.IsLogOptionEnabled("Language"));
    EXPECT_TRUE(logFile.IsLogOptionEnabled("ThreadId"));
    EXPECT_FALSE(logFile.IsLogOptionEnabled("Keys"));
    logFile.WriteLog("from the registry", "Startup");
    logFile.WriteLog("not enabled", "Locale");
    std::string text = nxtest::ReadFile(dir.File("registry-options.log"));
    EXPECT_THAT(text, HasSubstr("ThreadId: ")) << text;
    EXPECT_THAT(text, HasSubstr("from the registry")) << text;
    EXPECT_THAT(text, Not(HasSubstr("not enabled"))) << text;
}

TEST_F(RegistryTest, AKeyHolderFreesNoHiveAndANullKeyIsRefused) {
    {
        HKeyHolder holder;
        *holder.GetHKeyPtr() = HKEY_CURRENT_USER;  // a hive is never freed
    }
    EXPECT_THROW(RegistryHandler::GetRegistryEntry(RegistryEntry(nullptr, "a", "b")),
                 nxbase::RegistryError);
}

}  // namespace
