// The ICC colour engine (LittleCMS 2): Lab (D50 PCS) to display RGB through
// the user's ICC display profile, and the static ICCProfile switch. Any thread
// may convert; create or replace the engine on one thread at start-up.
//
// Configuration, user configuration group "Settings":
//   "ICCProfile"      "0" (default) keeps the engine off; any other number turns it on.
//   "ICCProfilePath"  path of the ICC display profile ("\" or "/" separators).
// A missing, unreadable, grey, CMYK or otherwise unusable profile never raises:
// ProfileValid() is false, the colour converter uses its built-in formulas, and
// one line saying why goes to the log.
#ifndef NXBASE_ICCPROFILE_H_
#define NXBASE_ICCPROFILE_H_

#include <atomic>
#include <cstddef>
#include <functional>
#include <string>

#include "nxbase/export.h"
#include "nxbase/singleton.h"
#include "toolkit/string.h"

class NXBASE_EXPORT ICCEngine : public NxSingleton {
  public:
    // Configuration keys, group "Settings" of the user configuration.
    static constexpr const char* kGroup = "Settings";
    static constexpr const char* kEnableKey = "ICCProfile";
    static constexpr const char* kPathKey = "ICCProfilePath";

    // The engine, created from the configuration on first use (by whichever
    // thread comes first).
    static ICCEngine* Instance();
    // Creates the engine afresh from the configuration (replacing a live one;
    // no conversion may be running meanwhile).
    static ICCEngine* CreateICCEngine();

    ~ICCEngine() override;
    ICCEngine(const ICCEngine&) = delete;
    ICCEngine& operator=(const ICCEngine&) = delete;

    // True when the configured profile loaded as an RGB output profile and its
    // transform from Lab was built.
    bool ProfileOK() const { return amTransform != nullptr; }
    bool IsEnabled() const { return amEnabled; }
    // Switching on loads the configured profile if that was not tried yet.
    // Switch on and off on one thread, before conversions run elsewhere.
    void SetEnabled(bool axEnabled);
    // True when conversions go through the profile: valid and enabled.
    bool IsActive() const { return amEnabled && ProfileOK(); }

    // Lab (CIE 1976, relative to D50, L 0..100) to display RGB 0..1 per
    // channel, relative colorimetric intent, clipped to the device range.
    // Returns false (leaving `rgb` alone) when no profile is loaded.
    bool LabToRGB(const double lab[3], double rgb[3]) const;
    // The same for `count` Lab triples at once.
    bool LabToRGB(const double* lab, double* rgb, std::size_t count) const;

    // The profile's description ("" when none loaded).
    const String& GetProfileName() const { return amProfileName; }
    // The engine version: LittleCMS's, "2.14" for example.
    const String& GetVersion() const { return amVersion; }
    const std::string& GetProfilePath() const { return amProfilePath; }
    // Why the profile is not in use ("" when it is, or when the engine is off).
    const std::string& GetProblem() const { return amProblem; }

    // Use Instance() or CreateICCEngine(); the object reads no configuration itself.
    ICCEngine();

  private:
    void Load();
    void LoadProfile();

    std::atomic<bool> amEnabled{false};
    bool amProfileTried = false;
    std::string amLcmsError;
    String amProfileName;
    String amVersion = "1.0";
    std::string amProfilePath;
    std::string amProblem;
    void* amContext = nullptr;    // cmsContext
    void* amTransform = nullptr;  // cmsHTRANSFORM, shared by all threads (no 1-pixel cache)

    static ICCEngine* smInstance;
    // The loaded engine, for the lock-free fast path of Instance().
    static std::atomic<ICCEngine*> smPublished;
};

// The static switch and status of the ICC engine.
class NXBASE_EXPORT ICCProfile {
  public:
    // The profile is loaded and usable.
    static bool ProfileValid();
    // The engine is switched on (by configuration or EnableProfile).
    static bool ProfileEnabled();
    // Switches the engine on or off for this process; the configuration is not written.
    static void EnableProfile(bool axEnable);
    static String GetProfileName();
};

namespace nxbase {

// Reads one key of the user configuration's group "Settings", returning
// `def` when the key is absent.
using SettingsReader = std::function<std::string(const std::string& key, const std::string& def)>;

// Replaces where the ICC engine reads its two keys (null: the user
// configuration). Returns the previous reader. Takes effect at the next
// CreateICCEngine().
NXBASE_EXPORT SettingsReader SetICCSettingsReader(SettingsReader reader);

}  // namespace nxbase

#endif  // NXBASE_ICCPROFILE_H_
