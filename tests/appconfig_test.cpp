// The application's name, directories, configuration files and settings.
#include "nxbase/appconfig.h"

#include <gtest/gtest.h>
#include <sys/stat.h>
#include <unistd.h>

#include <filesystem>
#include <iterator>
#include <memory>
#include <string>

#include "nxbase/appsetti.h"
#include "nxbase/files.h"
#include "nxbase/registry.h"
#include "test_util.h"
#include "toolkit/config.h"
#include "toolkit/userinterface.h"

namespace {

using nxtest::ReadFile;
using nxtest::ScopedEnv;
using nxtest::TempDir;
using nxtest::WriteFile;

class AppConfigTest : public ::testing::Test {
  protected:
    void SetUp() override { NxSingleton::DeleteAllSingleton(); }
    void TearDown() override { NxSingleton::DeleteAllSingleton(); }
    TempDir dir;
    ScopedEnv xdg{"XDG_CONFIG_HOME", dir.path().string()};
};

TEST_F(AppConfigTest, SingletonsFailWithTheirMessagesUntilCreated) {
    auto message = [](auto instance) {
        try {
            instance();
        } catch (const std::logic_error& e) {
            return std::string(e.what());
        } catch (const std::runtime_error& e) {
            return std::string("runtime_error: ") + e.what();
        }
        return std::string("no exception");
    };
    EXPECT_EQ(message([] { AppName::Instance(); }), "Please create the AppName-Singleton first !");
    EXPECT_EQ(message([] { AppDir::Instance(); }), "Please create the AppDir-Singleton first !");
    EXPECT_EQ(message([] { VELTRAConfig::Instance(); }),
              "Please create the VELTRAConfig-Singleton first !");
    EXPECT_EQ(message([] { AppConfig::Instance(); }), "runtime_error: No AppConfig instance");
    EXPECT_EQ(message([] { UserConfig::Instance(); }), "runtime_error: No UserConfig instance");

    AppName* first = AppName::CreateAppName("Check", "ColorCheck", "K-Lume ColorCheck",
                                            ApplicationVersion(2, 10, 3));
    EXPECT_EQ(first->GetVersionString(), "2.10");
    std::size_t registered = NxSingleton::RegisteredCount();
    AppName::CreateAppName("Other", "Other", "Other", ApplicationVersion(1, 0));
    EXPECT_EQ(NxSingleton::RegisteredCount(), registered);
    EXPECT_EQ(AppName::Instance()->GetShortName(), "Other");
}

TEST_F(AppConfigTest, DirectoriesDeriveFromTheExecutablePath) {
    AppDir* appDir = AppDir::CreateAppDir("/opt/k-lume/bin/colorcheck");
    EXPECT_EQ(appDir->BinDirEntry().GetFull(), "/opt/k-lume/bin");
    EXPECT_EQ(appDir->RootDirEntry().GetFull(), "/opt/k-lume");
    EXPECT_EQ(appDir->LngDirEntry().GetFull(), "/opt/k-lume/LNG");
    EXPECT_EQ(appDir->HlpDirEntry().GetFull(), "/opt/k-lume/DOC");
    // Windows-style separators are accepted.
    AppDir::CreateAppDir("\\opt\\k-lume\\bin\\colorcheck.exe");
    EXPECT_EQ(AppDir::Instance()->RootDirEntry().GetFull(), "/opt/k-lume");
    // /proc is a mount of its own; a path that does not exist is looked up
    // through its nearest existing ancestor.
    AppDir::CreateAppDir("/proc/self/missing/app");
    EXPECT_EQ(AppDir::Instance()->TargetDisk().GetFull(), "/proc");
    AppDir::CreateAppDir("/no/such/dir/app");
    EXPECT_EQ(AppDir::Instance()->TargetDisk().GetFull(), "/");
}

// A derived directory layout: the binaries one level deeper.
class ArchAppDir : public AppDir {
  public:
    explicit ArchAppDir(const String& path) : AppDir(path) {}
    DirEntry BinDirEntry() const override { return AppDir::BinDirEntry().GetPath(); }
    static void Install(const String& path) { SetAppDir(new ArchAppDir(path)); }
};

TEST_F(AppConfigTest, ADerivedBinaryDirectoryMovesTheRootWithIt) {
    AppDir::CreateAppDir("/opt/a/bin/app");
    ArchAppDir::Install("/opt/k-lume/bin/x86_64/app");
    EXPECT_EQ(AppDir::Instance()->BinDirEntry().GetFull(), "/opt/k-lume/bin");
    EXPECT_EQ(AppDir::Instance()->LngDirEntry().GetFull(), "/opt/k-lume/LNG");
}

TEST_F(AppConfigTest, TheUserDirectoryFollowsXdgThenHomeAndIsCreated) {
    const std::string expected = dir.path().string() + "/K-Lume";
    EXPECT_EQ(UserConfig::GetConfigDirectoryPath(), String(expected));
    EXPECT_TRUE(std::filesystem::is_directory(expected));
    {
        ScopedEnv relative("XDG_CONFIG_HOME", "relative/dir");
        ScopedEnv home("HOME", dir.File("home"));
        EXPECT_EQ(UserConfig::GetConfigDirectoryPath(),
                  String(dir.File("home") + "/.config/K-Lume"));
        EXPECT_TRUE(std::filesystem::is_directory(dir.File("home") + "/.config/K-Lume"));
        // The registry's hive lies in the same directory, by the same rule.
        ScopedEnv hive("NXBASE_USER_REGISTRY", "");
        EXPECT_EQ(nxbase::RegistryHiveFile(nxbase::RegistryHive::CurrentUser),
                  dir.File("home") + "/.config/K-Lume/registry.sqlite");
    }
}

TEST_F(AppConfigTest, FileNamesLoseForbiddenCharacters) {
    EXPECT_EQ(MakeValidFileName("Color Check"), "Color Check");
    EXPECT_EQ(MakeValidFileName("a\\b/c:d*e?f\"g<h>i|j"), "a_b_c_d_e_f_g_h_i_j");
    EXPECT_EQ(MakeValidFileName("tab\there"), "tab_here");
    EXPECT_EQ(MakeValidFileName(".."), "__");
    EXPECT_EQ(MakeValidFileName("name. "), "name__");
    EXPECT_EQ(MakeValidFileName(""), "_");
    EXPECT_EQ(MakeValidFileName("Caf\xE9"), "Caf\xE9");
}

TEST_F(AppConfigTest, WholeFileWritesKeepHardLinksAndTheFilesOwner) {
    const std::string file = dir.File("export.reg");
    const std::string other = dir.File("second-name.reg");
    WriteFile(file, "old\n");
    ASSERT_EQ(::link(file.c_str(), other.c_str()), 0);
    nxbase::WriteWholeFile(file, "new\n");
    EXPECT_EQ(ReadFile(other), "new\n");
    EXPECT_EQ(std::filesystem::hard_link_count(file), 2u);

    // A new file gets the mode open() would give it under the umask.
    const mode_t mask = ::umask(027);
    nxbase::WriteWholeFile(dir.File("fresh.reg"), "x\n");
    ::umask(mask);
    struct stat fresh {};
    ASSERT_EQ(::stat(dir.File("fresh.reg").c_str(), &fresh), 0);
    EXPECT_EQ(fresh.st_mode & 0777, 0640u);

    // Root writing a user's file leaves it the user's.
    if (::geteuid() == 0) {
        const std::string users = dir.File("users.reg");
        WriteFile(users, "old\n");
        ASSERT_EQ(::chown(users.c_str(), 65534, 65534), 0);
        nxbase::WriteWholeFile(users, "new\n");
        struct stat info {};
        ASSERT_EQ(::stat(users.c_str(), &info), 0);
        EXPECT_EQ(info.st_uid, 65534u);
        EXPECT_EQ(info.st_gid, 65534u);
        EXPECT_EQ(ReadFile(users), "new\n");
    }

    // A directory closed to new files, written by a user whom permissions
    // bind (root is dropped to user 65534): the writable file is rewritten in
    // place and nothing else appears beside it.
    TempDir shared(TempDir::Reach::kOtherUsers);
    const std::string closed = shared.File("closed");
    const std::string data = closed + "/data.reg";
    std::filesystem::create_directory(closed);
    WriteFile(data, "old\n");
    if (::geteuid() == 0) {
        ASSERT_EQ(::chmod(shared.path().c_str(), 0755), 0);
        ASSERT_EQ(::chown(closed.c_str(), 65534, 65534), 0);
        ASSERT_EQ(::chown(data.c_str(), 65534, 65534), 0);
    }
    ASSERT_EQ(::chmod(closed.c_str(), 0555), 0);
    const int code = nxtest::InChild([&] {
        if (!nxtest::DropRoot()) return 2;
        nxbase::WriteWholeFile(data, "new\n");  // a throw exits 125
        return 0;
    });
    ::chmod(closed.c_str(), 0755);
    EXPECT_EQ(code, 0);
    EXPECT_EQ(ReadFile(data), "new\n");
    EXPECT_EQ(std::distance(std::filesystem::directory_iterator(closed),
                            std::filesystem::directory_iterator()),
              1);
}

TEST_F(AppConfigTest, TheUserFileIsNamedAfterTheApplicationAndSeededFromDefaults) {
    const std::string defaults = dir.File("defaults.ini");
    WriteFile(defaults, "[Settings]\nDirectLightPart = 0.25\n");
    UserConfig* user = UserConfig::CreateUserConfig("Color:Check", "", String(defaults));
    const std::string path = dir.path().string() + "/K-Lume/Color_Check.ini";
    EXPECT_EQ(user->GetPath(), String(path));
    EXPECT_EQ(user->ReadKey("settings", "directlightpart"), "0.25");
    // An existing user file is never replaced by the defaults.
    user->WriteKey("Settings", "DirectLightPart", "0.75");
    UserConfig::CreateUserConfig("Color:Check.INI", "", String(defaults));
    EXPECT_EQ(UserConfig::Instance()->GetPath(),
              String(dir.path().string() + "/K-Lume/Color_Check.INI"));
    UserConfig::CreateUserConfig("Color:Check", "", String(defaults));
    EXPECT_EQ(UserConfig::Instance()->ReadKey("Settings", "DirectLightPart"), "0.75");
    EXPECT_FALSE(std::filesystem::exists(path + ".copy." + std::to_string(::getpid())));

    AppConfig::CreateAppConfig(String(dir.path().string()), "app");
    EXPECT_EQ(AppConfig::Instance()->GetPath(), String(dir.File("app.ini")));
    AppConfig::CreateAppConfig("", String(dir.File("settings.cfg")));
    EXPECT_EQ(AppConfig::Instance()->GetPath(), String(dir.File("settings.cfg")));

    AppName::CreateAppName("Check", "Color/Check", "K-Lume ColorCheck", ApplicationVersion(1, 0));
    LocalConfig local;
    EXPECT_EQ(local.GetPath(), String(dir.path().string() + "/K-Lume/Color_Check.ini"));
}

TEST_F(AppConfigTest, KeyCountNamesAndEmptyGroupFollowTheFile) {
    const std::string path = dir.File("app.ini");
    WriteFile(path, "[Devices]\nSpectro = 1\nDensito = 2\n[Other]\nx = 1\n");
    AppConfig* app = AppConfig::CreateAppConfig(String(dir.path().string()), "app.ini");
    EXPECT_EQ(app->GetKeyCount("DEVICES"), 2);
    EXPECT_EQ(app->GetKeyName("Devices", 1), "Densito");
    EXPECT_EQ(app->GetKeyName("Devices", 2), "");
    EXPECT_EQ(app->ReadKey("Devices", "Missing"), "");
    EXPECT_TRUE(app->EmptyGroup("devices"));
    EXPECT_EQ(app->GetKeyCount("Devices"), 0);
    EXPECT_EQ(ReadFile(path), "[Other]\nx = 1\n");
}

TEST_F(AppConfigTest, VeltraGroupsAndChromaLinkApplicationsByIndex) {
    const std::string path = dir.File("veltra.ini");
    WriteFile(path,
              "[ChromaLink Applications]\nColorCheck = 1\nProfiler = 1\n"
              "[LPM-Server]\nPath = /opt/k-lume/bin/lumaserver\n");
    VELTRAConfig* veltra = VELTRAConfig::CreateVELTRAConfig(String(path));
    const char* names[] = {"LPM-Server",
                           "Gradus",
                           "ChromaLink Applications",
                           "Compatibility",
                           "32-Bit Applications",
                           "Color Libraries",
                           "Licenses"};
    for (int i = 0; i < 7; ++i) {
        EXPECT_EQ(VELTRAConfig::GetGroupName(static_cast<VELTRAiniGroup>(i)), names[i]);
    }
    EXPECT_EQ(veltra->ReadVELTRAKey(VELTRA_LPM_SERVER, "path"), "/opt/k-lume/bin/lumaserver");
    EXPECT_EQ(veltra->ReadVELTRAKey(VELTRA_GRADUS, "Steps", "12"), "12");
    EXPECT_TRUE(veltra->WriteVELTRAKey(VELTRA_LICENSES, "Key", "ABC"));
    Config reread{String(path)};
    reread.SetGroup("Licenses");
    EXPECT_EQ(reread.ReadKey("Key"), "ABC");

    EXPECT_EQ(veltra->ReadChromaLinkApplication(0), "ColorCheck");
    EXPECT_EQ(veltra->ReadChromaLinkApplication(1), "Profiler");
    EXPECT_EQ(veltra->ReadChromaLinkApplication(2), "");
    EXPECT_EQ(veltra->ReadChromaLinkApplication(-1), "");

    auto ui = std::make_shared<RecordingUserInterface>(false);
    ScopedUserInterface scope(ui);
    EXPECT_EQ(VELTRAConfig::GetGroupName(static_cast<VELTRAiniGroup>(7)), "");
    ASSERT_EQ(ui->Boxes().size(), 1u);
    EXPECT_THAT(ui->Boxes()[0].text, HasSubstr("\"Unknown VELTRAConfig group name\" == 0"));
}

TEST_F(AppConfigTest, SettingsReadDefaultsWithoutAUserFileAndRoundTripThroughIt) {
    NxSetting* settings = NxSetting::Instance();
    EXPECT_EQ(settings->GetMeasurementDisplay(), NxSetting::INSTRUMENT);
    EXPECT_DOUBLE_EQ(settings->GetDirectLightPart(), 0.5);
    EXPECT_EQ(settings->GetIllumClass1(), IllumClass());

    UserConfig* user = UserConfig::CreateUserConfig("Settings Test", "", "");
    user->WriteKey("Settings", "MeasurementDisplay", "eye");  // case matters
    user->WriteKey("Settings", "DirectLightPart", "0.125");
    user->WriteKey("Settings", "MetamerieTL1", "D65");
    settings->LoadProperties();
    EXPECT_EQ(settings->GetMeasurementDisplay(), NxSetting::INSTRUMENT);
    EXPECT_DOUBLE_EQ(settings->GetDirectLightPart(), 0.125);
    EXPECT_EQ(settings->GetIllumClass1().GetName(), "D65");

    settings->SetMeasurementDisplay(NxSetting::EYE);
    settings->SetDirectLightPart(0.333);
    settings->SetIllumClasses(IllumClass(ILLUM_A, 0), IllumClass(std::string("FL11")));
    settings->SaveProperties();
    EXPECT_EQ(user->ReadKey("Settings", "MeasurementDisplay"), "Eye");
    EXPECT_EQ(user->ReadKey("Settings", "DirectLightPart"), "0.33");
    EXPECT_EQ(user->ReadKey("Settings", "MetamerieTL2"), "FL11");

    // The whole value as a decimal number, a "+" allowed: else the default.
    for (const auto& [text, part] : {std::pair{"1.25", 1.25},
                                     {"+0.75", 0.75},
                                     {"0.5x", 0.5},
                                     {"1,25", 0.5},
                                     {"+-0.5", 0.5},
                                     {"", 0.5}}) {
        user->WriteKey("Settings", "DirectLightPart", text);
        settings->LoadProperties();
        EXPECT_DOUBLE_EQ(settings->GetDirectLightPart(), part) << text;
    }
    user->WriteKey("Settings", "DirectLightPart", "not a number");
    NxSingleton::DeleteAllSingleton();
    UserConfig::CreateUserConfig("Settings Test", "", "");
    NxSetting* fresh = NxSetting::Instance();
    EXPECT_EQ(fresh->GetMeasurementDisplay(), NxSetting::EYE);
    EXPECT_DOUBLE_EQ(fresh->GetDirectLightPart(), 0.5);
    IllumClass first, second;
    fresh->GetIllumClasses(first, second);
    EXPECT_EQ(first.GetName(), "A");
    EXPECT_EQ(second.GetName(), "FL11");
}

}  // namespace
