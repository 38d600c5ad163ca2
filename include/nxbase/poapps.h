// The applications a post office knows: the measuring-device server
// LumaServer and the peer applications registered in the machine hive, with
// where their executables lie so that they can be started.
//
// Registry (HKEY_LOCAL_MACHINE):
//   Software\K-Lume\LumaServer              Path, Executable (full path), Version
//   Software\K-Lume\ChromaLink\Applications <id> = full path of the executable
#ifndef NXBASE_POAPPS_H_
#define NXBASE_POAPPS_H_

#include <boost/shared_ptr.hpp>
#include <chrono>
#include <map>
#include <string>
#include <vector>

#include "nxbase/export.h"

namespace nxbase {
// Seconds a wait that nobody can abort may last: $NXBASE_WAIT_TIMEOUT when it
// is decimal digits only giving 1..86399, else 0 (unset, "+20", " 20", "1.5",
// a day or more): no limit.
NXBASE_EXPORT int WaitTimeoutSeconds();
// How long one send waits for an application it started: 10 s, or
// $NXBASE_WAIT_TIMEOUT if that is shorter.
NXBASE_EXPORT std::chrono::seconds StartWaitLimit();
// For tools: where the server's registration lives and how to write it, to
// follow the set-up errors about LumaServer.
NXBASE_EXPORT std::string ServerRegistrationHint();
}  // namespace nxbase

class NXBASE_EXPORT PostOfficeApplication {
  public:
    PostOfficeApplication() = default;
    // Splits `asExecutablePath` at its last "/" or "\": the path is what
    // stands before it, the executable what follows. With a "." after the
    // separator, the name is the executable up to its last "."; without one
    // (a Linux program such as /opt/k-lume/bin/lumaserver) the name is the
    // whole executable. A path without a separator, or one that ends in it,
    // throws std::runtime_error "Illegal path: " + path.
    PostOfficeApplication(const std::string& asId, const std::string& asExecutablePath);
    PostOfficeApplication(const std::string& asId, const std::string& asName,
                          const std::string& asExecutable, const std::string& asPath);

    const std::string& GetId() const { return amId; }
    const std::string& GetName() const { return amName; }
    const std::string& GetExecutable() const { return amExecutable; }
    const std::string& GetPath() const { return amPath; }
    // Path, "/" and executable.
    std::string GetExecutableWithPath() const;
    // The start line: the executable with its path, "/WM" for "KXALWIN",
    // then "-S", "-LNG" and `alCountryCode`.
    std::vector<std::string> StartLine(int alCountryCode) const;
    // Starts the application in its directory with the start line and the
    // current language's country code (1 without a language): the process
    // id, or -1 with `asError` set. The process is reaped when it ends.
    int Start(std::string& asError) const;

  private:
    std::string amId;
    std::string amName;
    std::string amExecutable;
    std::string amPath;
};

class NXBASE_EXPORT PostOfficeApplications {
  public:
    using ApplicationMap = std::map<std::string, boost::shared_ptr<PostOfficeApplication>>;

    // Reads the table for the application `asOwnAppName`. A process that is
    // the server itself reads nothing. Otherwise a server that is missing or
    // older than version 3.0 (its Version digits with at most one ".", read
    // without the locale) throws std::runtime_error with the texts
    // "LumaServer missing or old!", "Unknown LumaServer version! Please
    // reinstall LumaServer" or "Old LumaServer found! Please reinstall new
    // LumaServer."; peers whose executable does not exist are skipped.
    explicit PostOfficeApplications(const std::string& asOwnAppName);

    // True when `asAppName`, upper-cased, is "LUMASERVER" or "LPMSERV".
    static bool IsServerName(const std::string& asAppName);

    std::size_t GetApplicationCount() const { return amApplications.size(); }
    bool HasApplication(const std::string& asId) const;
    std::vector<std::string> GetApplications() const;
    const ApplicationMap& GetApplicationsMap() const { return amApplications; }
    // Empty when unknown.
    boost::shared_ptr<PostOfficeApplication> GetApplication(const std::string& asId) const;
    // Throws std::runtime_error "Unknown application: " + id when unknown.
    PostOfficeApplication GetApplicationInfo(const std::string& asId) const;

  private:
    void AddServer();
    void AddPeers();

    ApplicationMap amApplications;
};

#endif  // NXBASE_POAPPS_H_
