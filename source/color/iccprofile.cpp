#include "nxbase/iccprofile.h"

#include <lcms2.h>

#include <algorithm>
#include <charconv>
#include <mutex>

#include "nxbase/appconfig.h"
#include "nxbase/logfile.h"
#include "toolkit/system.h"

namespace {

constexpr cmsUInt32Number kIntent = INTENT_RELATIVE_COLORIMETRIC;

std::mutex& ReaderMutex() {
    static std::mutex mutex;
    return mutex;
}

nxbase::SettingsReader& InstalledReader() {
    static nxbase::SettingsReader reader;
    return reader;
}

// The key of the user configuration's group "Settings" (or of an installed
// reader); the default while no user configuration exists.
std::string ReadUserSetting(const std::string& key, const std::string& def) {
    nxbase::SettingsReader reader;
    {
        std::lock_guard<std::mutex> lock(ReaderMutex());
        reader = InstalledReader();
    }
    if (reader) return reader(key, def);
    if (!UserConfig::IsInitialized()) return def;
    return UserConfig::Instance()
        ->ReadKey(String(ICCEngine::kGroup), String(key), String(def))
        .str();
}

// "ICCProfile" is on when it reads as a non-zero number.
bool ReadsAsNonZero(const std::string& text) {
    auto first = text.find_first_not_of(" \t");
    if (first == std::string::npos) return false;
    double value = 0.0;
    const char* begin = text.data() + first;
    auto result = std::from_chars(begin, text.data() + text.size(), value);
    return result.ec == std::errc() && value != 0.0;
}

// LittleCMS reports its errors here; the last one explains a failed load.
void RememberError(cmsContext context, cmsUInt32Number, const char* text) {
    auto* problem = static_cast<std::string*>(cmsGetContextUserData(context));
    if (problem != nullptr && text != nullptr) *problem = text;
}

std::string VersionText() {
    int encoded = cmsGetEncodedCMMversion();  // 2140 for 2.14
    return std::to_string(encoded / 1000) + "." + std::to_string(encoded % 1000 / 10);
}

}  // namespace

ICCEngine* ICCEngine::smInstance = nullptr;
std::atomic<ICCEngine*> ICCEngine::smPublished{nullptr};

namespace {
// Serialises the first creation when several threads convert at once.
std::mutex gCreateMutex;
}  // namespace

ICCEngine::ICCEngine() : NxSingleton("ICCEngine") {}

ICCEngine::~ICCEngine() {
    if (amTransform != nullptr) cmsDeleteTransform(static_cast<cmsHTRANSFORM>(amTransform));
    if (amContext != nullptr) cmsDeleteContext(static_cast<cmsContext>(amContext));
    if (smInstance == this) smInstance = nullptr;
    ICCEngine* self = this;
    smPublished.compare_exchange_strong(self, nullptr);
}

ICCEngine* ICCEngine::Instance() {
    if (ICCEngine* engine = smPublished.load(std::memory_order_acquire)) return engine;
    std::lock_guard<std::mutex> lock(gCreateMutex);
    ICCEngine* engine =
        nxbase::LazySingletonInstance(smInstance, [](ICCEngine& created) { created.Load(); });
    smPublished.store(engine, std::memory_order_release);
    return engine;
}

ICCEngine* ICCEngine::CreateICCEngine() {
    std::lock_guard<std::mutex> lock(gCreateMutex);
    ICCEngine* engine = nxbase::CreateOrReplaceSingleton(smInstance);
    engine->Load();
    smPublished.store(engine, std::memory_order_release);
    return engine;
}

void ICCEngine::Load() {
    amVersion = VersionText();
    amEnabled = ReadsAsNonZero(ReadUserSetting(kEnableKey, "0"));
    amProfilePath = toolkit::NormalizePath(ReadUserSetting(kPathKey, ""));
    if (amEnabled) LoadProfile();  // never touch the profile while switched off
}

// An engine whose profile cannot be loaded is disabled.
void ICCEngine::SetEnabled(bool axEnabled) {
    amEnabled = axEnabled;
    if (axEnabled && !amProfileTried) LoadProfile();
    if (amTransform == nullptr) amEnabled = false;
}

void ICCEngine::LoadProfile() {
    amProfileTried = true;
    // The error handler keeps LittleCMS's last message in amLcmsError.
    std::string& lcmsError = amLcmsError;
    cmsContext context = cmsCreateContext(nullptr, &amLcmsError);
    if (context == nullptr) {
        amProblem = "LittleCMS context could not be created";
    } else {
        amContext = context;
        cmsSetLogErrorHandlerTHR(context, RememberError);
        cmsHPROFILE display = nullptr;
        if (amProfilePath.empty()) {
            amProblem = "no profile configured (key \"" + std::string(kPathKey) + "\")";
        } else if ((display = cmsOpenProfileFromFileTHR(context, amProfilePath.c_str(), "r")) ==
                   nullptr) {
            amProblem = "cannot read \"" + amProfilePath + "\"" +
                        (lcmsError.empty() ? "" : ": " + lcmsError);
        } else if (cmsGetColorSpace(display) != cmsSigRgbData) {
            amProblem = "\"" + amProfilePath + "\" is not an RGB profile";
        } else if (!cmsIsIntentSupported(display, kIntent, LCMS_USED_AS_OUTPUT)) {
            amProblem = "\"" + amProfilePath + "\" cannot be used as an output profile";
        } else {
            cmsHPROFILE lab = cmsCreateLab4ProfileTHR(context, nullptr);  // D50 PCS
            cmsHTRANSFORM transform =
                lab == nullptr ? nullptr
                               : cmsCreateTransformTHR(context, lab, TYPE_Lab_DBL, display,
                                                       TYPE_RGB_DBL, kIntent, cmsFLAGS_NOCACHE);
            if (lab != nullptr) cmsCloseProfile(lab);
            if (transform == nullptr) {
                amProblem = "no transform to \"" + amProfilePath + "\"" +
                            (lcmsError.empty() ? "" : ": " + lcmsError);
            } else {
                amTransform = transform;
                char description[256] = {0};
                cmsGetProfileInfoASCII(display, cmsInfoDescription, "en", "US", description,
                                       sizeof description);
                amProfileName = String(std::string(description));
            }
        }
        if (display != nullptr) cmsCloseProfile(display);
    }
    if (amTransform == nullptr) {
        amEnabled = false;
        LogFile::WriteToLog(
            String("ICC profile not used, colours from the built-in formulas: " + amProblem),
            String());
    } else {
        LogFile::WriteToLog(
            String("ICC profile \"" + std::string(amProfileName.str()) + "\" from \"" +
                   amProfilePath + "\", LittleCMS " + amVersion.str()),
            String("ColorConverter"));
    }
}

bool ICCEngine::LabToRGB(const double lab[3], double rgb[3]) const {
    return LabToRGB(lab, rgb, 1);
}

bool ICCEngine::LabToRGB(const double* lab, double* rgb, std::size_t count) const {
    if (amTransform == nullptr) return false;
    // LittleCMS counts pixels in 32 bits.
    constexpr std::size_t kChunk = 1u << 30;
    for (std::size_t done = 0; done < count; done += kChunk) {
        std::size_t n = std::min(kChunk, count - done);
        cmsDoTransform(static_cast<cmsHTRANSFORM>(amTransform), lab + 3 * done, rgb + 3 * done,
                       static_cast<cmsUInt32Number>(n));
    }
    for (std::size_t i = 0; i < 3 * count; ++i) rgb[i] = std::clamp(rgb[i], 0.0, 1.0);
    return true;
}

bool ICCProfile::ProfileValid() {
    return ICCEngine::Instance()->ProfileOK();
}

bool ICCProfile::ProfileEnabled() {
    return ICCEngine::Instance()->IsEnabled();
}

void ICCProfile::EnableProfile(bool axEnable) {
    ICCEngine::Instance()->SetEnabled(axEnable);
}

String ICCProfile::GetProfileName() {
    return ICCEngine::Instance()->GetProfileName();
}

namespace nxbase {

SettingsReader SetICCSettingsReader(SettingsReader reader) {
    std::lock_guard<std::mutex> lock(ReaderMutex());
    SettingsReader previous = std::move(InstalledReader());
    InstalledReader() = std::move(reader);
    return previous;
}

}  // namespace nxbase
