// ApplicationVersion is the toolkit's version number of an application:
// major, minor, revision and build. A value type.
#ifndef TOOLKIT_VERSION_H_
#define TOOLKIT_VERSION_H_

#include <string>

#include "toolkit/string.h"

class ApplicationVersion {
  public:
    ApplicationVersion() = default;
    ApplicationVersion(int major, int minor, int revision = 0, int build = 0)
        : amParts{major, minor, revision, build} {}

    int GetMajor() const { return amParts[0]; }
    int GetMinor() const { return amParts[1]; }
    int GetRevision() const { return amParts[2]; }
    int GetBuild() const { return amParts[3]; }

    // The first `components` numbers (1 to 4) joined by ".": "2.10" for two.
    String GetVersionString(int components = 2) const {
        if (components < 1) components = 1;
        if (components > 4) components = 4;
        std::string text = std::to_string(amParts[0]);
        for (int i = 1; i < components; ++i) text += "." + std::to_string(amParts[i]);
        return String(text);
    }

    bool operator==(const ApplicationVersion& o) const {
        return amParts[0] == o.amParts[0] && amParts[1] == o.amParts[1] &&
               amParts[2] == o.amParts[2] && amParts[3] == o.amParts[3];
    }

  private:
    int amParts[4] = {0, 0, 0, 0};
};

#endif  // TOOLKIT_VERSION_H_
