// nxreg as an administrator uses it: registering LumaServer and a peer,
// reading the log options, moving keys through REGEDIT4 files.
#include <gtest/gtest.h>
#include <sys/wait.h>

#include <cstdio>

#include "test_util.h"

namespace {

struct Result {
    int status = -1;
    std::string out;  // standard output and error
};

class NxregTest : public ::testing::Test {
  protected:
    Result Run(const std::string& arguments) {
        std::string command =
            std::string(NXBASE_BINARY_DIR) + "/tools/nxreg " + arguments + " 2>&1";
        Result result;
        FILE* pipe = ::popen(command.c_str(), "r");
        if (pipe == nullptr) return result;
        char buffer[4096];
        for (std::size_t n; (n = std::fread(buffer, 1, sizeof buffer, pipe)) > 0;) {
            result.out.append(buffer, n);
        }
        int status = ::pclose(pipe);
        result.status = WIFEXITED(status) ? WEXITSTATUS(status) : -1;
        return result;
    }

    nxtest::TempDir dir;
    nxtest::ScopedEnv user{"NXBASE_USER_REGISTRY", dir.File("user.sqlite")};
    nxtest::ScopedEnv machine{"NXBASE_MACHINE_REGISTRY", dir.File("machine.sqlite")};
};

TEST_F(NxregTest, RegistersTheServerAndPeersAndShowsThem) {
    const std::string server = "'HKLM\\Software\\K-Lume\\LumaServer'";
    for (const std::string& set :
         {"set " + server + " Path /opt/k-lume/bin",
          "set " + server + " Executable /opt/k-lume/bin/LumaServer", "set " + server + " Version 3.2",
          std::string("set 'HKEY_LOCAL_MACHINE\\Software\\K-Lume\\ChromaLink\\Applications' "
                      "ColorLab '/opt/k-lume/bin/ColorLab'")}) {
        EXPECT_EQ(Run(set).status, 0) << set;
    }

    Result version = Run("get 'hklm\\software\\k-lume\\lumaserver' VERSION");
    EXPECT_EQ(version.status, 0);
    EXPECT_EQ(version.out, "3.2\n");
    Result list = Run("list 'HKLM\\software\\k-lume'");
    EXPECT_EQ(list.status, 0);
    EXPECT_NE(list.out.find("HKEY_LOCAL_MACHINE\\Software\\K-Lume\n"), std::string::npos)
        << list.out;
    EXPECT_NE(list.out.find("[ChromaLink]"), std::string::npos) << list.out;
    EXPECT_NE(list.out.find("[LumaServer]"), std::string::npos) << list.out;

    EXPECT_EQ(Run("set --dword 'HKCU\\Software\\K-Lume\\App\\Log' Startup 1").status, 0);
    EXPECT_EQ(Run("set 'HKCU\\Software\\K-Lume\\App\\Log' Language 0").status, 0);
    Result options = Run("log-options 'Software\\K-Lume\\App'");
    EXPECT_EQ(options.status, 0);
    EXPECT_NE(options.out.find("Startup = 1  (enabled)"), std::string::npos) << options.out;
    EXPECT_NE(options.out.find("Language = 0  (disabled)"), std::string::npos) << options.out;
}

TEST_F(NxregTest, ExportDeleteImportRestoresTheKeys) {
    const std::string key = "'HKCU\\Software\\K-Lume\\Trip'";
    ASSERT_EQ(Run("set " + key + " Quoted 'a \"b\" c:\\d'").status, 0);
    ASSERT_EQ(Run("set --dword " + key + " Count 0x10").status, 0);
    const std::string file = dir.File("trip.reg");
    ASSERT_EQ(Run("export " + key + " " + file).status, 0);
    std::string text = nxtest::ReadFile(file);
    EXPECT_NE(text.find("\"Quoted\"=\"a \\\"b\\\" c:\\\\d\""), std::string::npos) << text;
    EXPECT_NE(text.find("\"Count\"=dword:00000010"), std::string::npos) << text;

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
    for (const char* usage :
         {"", "frobnicate", "get 'HKEY_USERS\\x' y", "set --dword 'HKCU\\x' y 12z", "delete HKCU"}) {
        EXPECT_EQ(Run(usage).status, 2) << usage;
    }

    const std::string bad = dir.File("bad.reg");
    nxtest::WriteFile(bad, "REGEDIT4\n[HKCU\\Software\\K-Lume]\n\"a\"=\"1\"\n\"b\"=dword:xyz\n");
    Result import = Run("import " + bad);
    EXPECT_EQ(import.status, 3);
    EXPECT_NE(import.out.find(bad + ":4: a dword needs"), std::string::npos) << import.out;
    EXPECT_EQ(Run("get 'HKCU\\Software\\K-Lume' a").status, 1);  // nothing applied

    nxtest::WriteFile(dir.File("user.sqlite"), std::string(4096, '#'));
    Result corrupt = Run("get 'HKCU\\Software' a");
    EXPECT_EQ(corrupt.status, 3);
    EXPECT_NE(corrupt.out.find(dir.File("user.sqlite")), std::string::npos) << corrupt.out;
}

}  // namespace
