// nxreg as an administrator uses it: registering LumaServer and a peer,
// reading the log options, moving keys through REGEDIT4 files.
#include <gtest/gtest.h>
#include <sys/stat.h>
#include <sys/wait.h>

#include <cstdio>
#include <cstdlib>
#include <filesystem>
#include <thread>

#include "test_util.h"

namespace {

using Result = nxtest::ShellResult;

class NxregTest : public ::testing::Test {
  protected:
    // Runs nxreg; `input`, when given, is a shell command piped into it.
    Result Run(const std::string& arguments, const std::string& input = "") {
        return nxtest::Shell((input.empty() ? "" : input + " | ") + Nxreg() + " " + arguments);
    }
    static std::string Nxreg() { return std::string(NXBASE_BINARY_DIR) + "/tools/nxreg"; }
    nxtest::TempDir dir;
    nxtest::ScopedEnv user{"NXBASE_USER_REGISTRY", dir.File("user.sqlite")};
    nxtest::ScopedEnv machine{"NXBASE_MACHINE_REGISTRY", dir.File("machine.sqlite")};
};

TEST_F(NxregTest, RegistersTheServerAndPeersAndShowsThem) {
    const std::string server = "'HKLM\\Software\\K-Lume\\LumaServer'";
    for (const std::string& set :
         {"set " + server + " Path /opt/k-lume/bin",
          "set " + server + " Executable /opt/k-lume/bin/LumaServer",
          "set " + server + " Version 3.2",
          std::string("set 'HKEY_LOCAL_MACHINE\\Software\\K-Lume\\ChromaLink\\Applications' "
                      "ColorLab '/opt/k-lume/bin/ColorLab'")}) {
        EXPECT_EQ(Run(set).status, 0) << set;
    }

    const Result version = Run("get 'hklm\\software\\k-lume\\lumaserver' VERSION");
    EXPECT_EQ(version.status, 0);
    EXPECT_EQ(version.out, "3.2\n");
    const Result list = Run("list 'HKLM\\software\\k-lume'");
    for (const char* part :
         {"HKEY_LOCAL_MACHINE\\Software\\K-Lume\n", "[ChromaLink]", "[LumaServer]"})
        EXPECT_THAT(list, nxtest::Exits(0, part));

    EXPECT_EQ(Run("set --dword 'HKCU\\Software\\K-Lume\\App\\Log' Startup 1").status, 0);
    EXPECT_EQ(Run("set 'HKCU\\Software\\K-Lume\\App\\Log' Language 0").status, 0);
    const Result options = Run("log-options 'Software\\K-Lume\\App'");
    EXPECT_THAT(options, nxtest::Exits(0, "Startup = 1  (enabled)"));
    EXPECT_THAT(options, nxtest::Exits(0, "Language = 0  (disabled)"));
}

TEST_F(NxregTest, ExportDeleteImportRestoresTheKeys) {
    const std::string key = "'HKCU\\Software\\K-Lume\\Trip'";
    ASSERT_EQ(Run("set " + key + " Quoted 'a \"b\" c:\\d'").status, 0);
    ASSERT_EQ(Run("set --dword " + key + " Count 0x10").status, 0);
    const std::string file = dir.File("trip.reg");
    ASSERT_EQ(Run("export " + key + " " + file).status, 0);
    std::string text = nxtest::ReadFile(file);
    EXPECT_THAT(text, HasSubstr("\"Quoted\"=\"a \\\"b\\\" c:\\\\d\"")) << text;
    EXPECT_THAT(text, HasSubstr("\"Count\"=dword:00000010")) << text;

    EXPECT_EQ(Run("delete " + key + " Count").status, 0);
    EXPECT_EQ(Run("delete " + key + " Count").status, 1);
    EXPECT_EQ(Run("delete " + key).status, 0);
    EXPECT_EQ(Run("get " + key + " Quoted").status, 1);
    EXPECT_EQ(Run("import " + file).status, 0);
    EXPECT_EQ(Run("get " + key + " Quoted").out, "a \"b\" c:\\d\n");
    EXPECT_EQ(Run("get " + key + " Count").out, "16\n");
    EXPECT_EQ(Run("export " + key).out, text);
}

TEST_F(NxregTest, BadUsageAndBadFilesGiveClearErrorsAndExitCodes) {
    EXPECT_EQ(Run("--help").status, 0);
    for (const char* usage : {"", "frobnicate", "get 'HKEY_USERS\\x' y",
                              "set --dword 'HKCU\\x' y 12z", "delete HKCU"}) {
        EXPECT_EQ(Run(usage).status, 2) << usage;
    }

    const std::string bad = dir.File("bad.reg");
    nxtest::WriteFile(bad, "REGEDIT4\n[HKCU\\Software\\K-Lume]\n\"a\"=\"1\"\n\"b\"=dword:xyz\n");
    EXPECT_THAT(Run("import " + bad), nxtest::Exits(3, bad + ":4: a dword needs"));
    EXPECT_EQ(Run("get 'HKCU\\Software\\K-Lume' a").status, 1);  // nothing applied

    // The first line is checked before the rest is read, and what is read is
    // bounded: endless inputs are refused instead of filling the memory.
    EXPECT_THAT(Run("import /dev/zero"),
                nxtest::Exits(3, "/dev/zero:1: the first line must be REGEDIT4"));
    EXPECT_THAT(Run("import -", "printf '\\177ELF\\002\\001\\n...'"),
                nxtest::Exits(3, "<stdin>:1: the first line must be REGEDIT4"));
    EXPECT_THAT(Run("import -", "{ printf 'REGEDIT4\\n'; cat /dev/zero; }"),
                nxtest::Exits(3, "<stdin>: more than 64 MiB"));

    nxtest::WriteFile(dir.File("user.sqlite"), std::string(4096, '#'));
    EXPECT_THAT(Run("get 'HKCU\\Software' a"), nxtest::Exits(3, dir.File("user.sqlite")));
}

TEST_F(NxregTest, OutputsKeepLinksFifosAndDevicesAndFailuresAreReported) {
    const std::string key = "'HKCU\\Software\\K-Lume\\Out'";
    ASSERT_EQ(Run("set " + key + " Name value").status, 0);
    // Standard output that cannot be written is a failure.
    EXPECT_EQ(Run("export " + key + " > /dev/full").status, 3);
    EXPECT_EQ(Run("list " + key + " > /dev/full").status, 3);
    // A device is written, never replaced by a plain file.
    EXPECT_EQ(Run("export " + key + " /dev/null").status, 0);
    EXPECT_EQ(Run("export " + key + " /dev/full").status, 3);
    struct stat info {};
    ASSERT_EQ(::stat("/dev/null", &info), 0);
    EXPECT_TRUE(S_ISCHR(info.st_mode));
    // A symlink stays a link; its target gets the text.
    std::string target = dir.File("real.reg");
    nxtest::WriteFile(target, "old");
    std::filesystem::create_symlink(target, dir.File("link.reg"));
    ASSERT_EQ(Run("export " + key + " " + dir.File("link.reg")).status, 0);
    EXPECT_TRUE(std::filesystem::is_symlink(dir.File("link.reg")));
    EXPECT_THAT(nxtest::ReadFile(target), HasSubstr("\"Name\"=\"value\""));
    // A FIFO is written through.
    std::string fifo = dir.File("pipe.reg");
    ASSERT_EQ(::mkfifo(fifo.c_str(), 0600), 0);
    std::string received;
    std::thread reader([&] { received = nxtest::ReadFile(fifo); });
    EXPECT_EQ(Run("export " + key + " " + fifo).status, 0);
    reader.join();
    EXPECT_THAT(received, HasSubstr("REGEDIT4"));
    struct stat fifoInfo {};
    ASSERT_EQ(::lstat(fifo.c_str(), &fifoInfo), 0);
    EXPECT_TRUE(S_ISFIFO(fifoInfo.st_mode));
    // Nothing is left beside the targets.
    for (const auto& entry : std::filesystem::directory_iterator(dir.path())) {
        EXPECT_THAT(entry.path().filename().string(), Not(HasSubstr(".XXX")));
        EXPECT_NE(entry.path().filename().string().front(), '.') << entry.path();
    }
}

TEST_F(NxregTest, AnImportTouchingBothHivesWritesBothOrNeither) {
    // The machine hive cannot be written (its directory does not exist and
    // cannot be made): the user hive must stay untouched as well.
    nxtest::ScopedEnv machineHive("NXBASE_MACHINE_REGISTRY", "/proc/nxbase-no/machine.sqlite");
    const std::string file = dir.File("both.reg");
    nxtest::WriteFile(file,
                      "REGEDIT4\n[HKEY_CURRENT_USER\\Software\\K-Lume\\Both]\n\"u\"=\"1\"\n"
                      "[HKEY_LOCAL_MACHINE\\Software\\K-Lume\\Both]\n\"m\"=\"1\"\n");
    EXPECT_EQ(Run("import " + file).status, 3);
    EXPECT_EQ(Run("get 'HKCU\\Software\\K-Lume\\Both' u").status, 1);
}

TEST_F(NxregTest, HivesOnAReadOnlyMountAreRead) {
    // A private mount namespace (user namespace for non-root) makes the
    // hives' directory a read-only bind mount for one nxreg run.
    if (std::system("unshare -rm true >/dev/null 2>&1") != 0) {
        GTEST_SKIP() << "cannot make a private mount namespace here (unshare -rm)";
    }
    ASSERT_EQ(Run("set 'HKCU\\Software\\K-Lume\\Ro' u user").status, 0);
    ASSERT_EQ(Run("set 'HKLM\\Software\\K-Lume\\Ro' m machine").status, 0);
    const std::string mount =
        "mount --bind -o ro '" + dir.path().string() + "' '" + dir.path().string() + "'";
    Result readOnly = nxtest::Shell("unshare -rm sh -c \"" + mount + " && " + Nxreg() +
                                    " get 'HKCU\\Software\\K-Lume\\Ro' u && " + Nxreg() +
                                    " get 'HKLM\\Software\\K-Lume\\Ro' m\"");
    EXPECT_EQ(readOnly.status, 0) << readOnly.out;
    EXPECT_EQ(readOnly.out, "user\nmachine\n");
}

}  // namespace
