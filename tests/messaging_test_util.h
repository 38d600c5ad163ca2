// Shared pieces of the messaging tests: a private sandbox (runtime directory,
// registry hives, log) per test, a copy of a peer program under a name of its
// own, and running the event loop until something happened.
#ifndef NXBASE_TESTS_MESSAGING_TEST_UTIL_H_
#define NXBASE_TESTS_MESSAGING_TEST_UTIL_H_

#include <dirent.h>
#include <signal.h>
#include <sys/socket.h>
#include <sys/un.h>
#include <sys/wait.h>
#include <unistd.h>

#include <chrono>
#include <cstdint>
#include <cstdlib>
#include <cstring>
#include <filesystem>
#include <fstream>
#include <functional>
#include <memory>
#include <string>
#include <vector>

#include "nxbase/mymemblo.h"
#include "nxbase/registry.h"
#include "test_util.h"
#include "toolkit/application.h"

namespace nxtest {

// Sanitizers keep freed memory in quarantine and add shadow memory, so
// resident sizes say nothing about the library there.
#if defined(__SANITIZE_ADDRESS__) || defined(__SANITIZE_THREAD__)
constexpr bool kSanitized = true;
#elif defined(__has_feature)
#if __has_feature(address_sanitizer) || __has_feature(thread_sanitizer)
constexpr bool kSanitized = true;
#else
constexpr bool kSanitized = false;
#endif
#else
constexpr bool kSanitized = false;
#endif

// In a forked child that runs an event loop: a reactor of its own, not the
// parent's epoll instance, which the fork shares.
inline void LoopOfItsOwn() {
    Application::Get().GetContext().notify_fork(boost::asio::execution_context::fork_child);
}

// A blocking stream socket connected to `path` (bound there instead when
// `bind`), or -1.
inline int ConnectUnix(const std::string& path, bool bind = false) {
    sockaddr_un address{};
    address.sun_family = AF_UNIX;
    if (path.size() >= sizeof address.sun_path) return -1;
    std::memcpy(address.sun_path, path.c_str(), path.size() + 1);
    int fd = ::socket(AF_UNIX, SOCK_STREAM | SOCK_CLOEXEC, 0);
    auto* where = reinterpret_cast<sockaddr*>(&address);
    if (fd >= 0 &&
        (bind ? ::bind(fd, where, sizeof address) : ::connect(fd, where, sizeof address))) {
        ::close(fd);
        return -1;
    }
    return fd;
}

// Whether something listens on the socket at `path` (it holds its name's
// lock a moment before it listens).
inline bool Accepts(const std::string& path) {
    const int fd = ConnectUnix(path);
    if (fd >= 0) ::close(fd);
    return fd >= 0;
}

// A number field of a /proc status file ("VmRSS", "voluntary_ctxt_switches"
// of "/proc/self/status", say); -1 when it is not there.
inline long ProcStatusField(const std::string& path, const std::string& field) {
    std::ifstream status(path);
    const std::string key = field + ":";
    for (std::string line; std::getline(status, line);) {
        if (line.rfind(key, 0) == 0) return std::stol(line.substr(key.size()));
    }
    return -1;
}

// Runs the loop until `done` or `limit`; false on the time-out.
inline bool RunUntil(const std::function<bool()>& done,
                     std::chrono::milliseconds limit = std::chrono::seconds(10)) {
    return Until(done, limit, [] { Application::Get().RunOneFor(std::chrono::milliseconds(10)); });
}

// The bytes of a memory block, and a block holding `bytes`.
inline std::string Bytes(const MyMemoryBlock& block) {
    return std::string(block.GetDatenZeiger(), static_cast<std::size_t>(block.Len()));
}
inline MyMemoryBlock Block(const std::string& bytes) {
    MyMemoryBlock block(static_cast<long>(bytes.size()));
    block.Put(bytes.data(), static_cast<long>(bytes.size()));
    return block;
}

// Runs the loop until the child `pid` ends; answers its exit code, -1 when
// it did not exit or not within `limit`.
inline int ExitWhileLooping(pid_t pid, std::chrono::milliseconds limit = std::chrono::seconds(10)) {
    int status = 0;
    if (!RunUntil([&] { return ::waitpid(pid, &status, WNOHANG) == pid; }, limit)) return -1;
    return WIFEXITED(status) ? WEXITSTATUS(status) : -1;
}

// The ids of the processes whose executable has the file name of `program`
// (the whole name: the kernel's process name, which pgrep -x compares, is cut
// to 15 characters); `most` ends the search early.
inline std::vector<pid_t> ProcessesNamed(const std::string& program, std::size_t most = SIZE_MAX) {
    const std::string name = program.substr(program.rfind('/') + 1);
    std::vector<pid_t> found;
    DIR* proc = ::opendir("/proc");
    if (proc == nullptr) return found;
    char target[4096];
    while (dirent* entry = ::readdir(proc)) {
        if (found.size() >= most) break;
        std::string link = std::string("/proc/") + entry->d_name + "/exe";
        ssize_t n = ::readlink(link.c_str(), target, sizeof target - 1);
        if (n <= 0) continue;
        std::string path(target, static_cast<std::size_t>(n));
        if (path.size() > 10 && path.compare(path.size() - 10, 10, " (deleted)") == 0)
            path.resize(path.size() - 10);
        if (path.substr(path.rfind('/') + 1) == name)
            found.push_back(static_cast<pid_t>(std::atoi(entry->d_name)));
    }
    ::closedir(proc);
    return found;
}

// The id of a process whose executable has the file name of `program`, or 0.
inline pid_t FindProcess(const std::string& program) {
    const std::vector<pid_t> found = ProcessesNamed(program, 1);
    return found.empty() ? 0 : found[0];
}

inline bool ProcessRunning(const std::string& program) {
    return FindProcess(program) != 0;
}

// A directory under /tmp (short: socket paths are limited to 108 bytes) that
// holds the runtime directory, both hives and the log, with the environment
// pointing there; removed at the end. LumaServer is registered at a path
// that does not exist, so that post offices can be set up.
class MessagingSandbox {
  public:
    explicit MessagingSandbox(const char* tag) {
        std::string pattern = std::string("/tmp/nxbase-") + tag + "-XXXXXX";
        std::vector<char> buffer(pattern.begin(), pattern.end());
        buffer.push_back('\0');
        root_ = ::mkdtemp(buffer.data()) ? buffer.data() : pattern;
        Env("NXBASE_RUNTIME_DIR", runtime());
        Env("USERNAME", "");
        Env("NXBASE_MACHINE_REGISTRY", root_ + "/machine.sqlite");
        Env("NXBASE_USER_REGISTRY", root_ + "/user.sqlite");
        Env("NXBASE_LOG_PATH", root_ + "/log");
        // Never the user's session bus: tests that use D-Bus start their own.
        Env("DBUS_SESSION_BUS_ADDRESS", "");
        Env("XDG_RUNTIME_DIR", "");
        std::filesystem::create_directories(root_ + "/bin");
        std::filesystem::create_directories(root_ + "/log");
    }
    ~MessagingSandbox() {
        StopBus();
        EndPrograms();
        env_.clear();
        std::error_code ignored;
        std::filesystem::remove_all(root_, ignored);
    }
    MessagingSandbox(const MessagingSandbox&) = delete;
    MessagingSandbox& operator=(const MessagingSandbox&) = delete;

    const std::string& root() const { return root_; }
    std::string runtime() const { return root_ + "/run"; }

    void Env(const char* name, const std::string& value) {
        env_.emplace_back(std::make_unique<ScopedEnv>(name, value));
    }
    static void Register(const char* key, const char* name, const std::string& value) {
        RegistryHandler::AddRegistryEntry(RegistryEntry(HKEY_LOCAL_MACHINE, key, name), value);
    }
    void RegisterAbsentServer() {
        Register("Software\\K-Lume\\LumaServer", "Path", "/none");
        Register("Software\\K-Lume\\LumaServer", "Executable", "/none/lumaserver");
        Register("Software\\K-Lume\\LumaServer", "Version", "3.0");
    }
    // Copies `program` into bin/ as <base><pid>: a name no other test's
    // process has, since "is it running" looks at executable names.
    std::string CopyProgram(const std::string& program, const std::string& base) {
        std::string copy = root_ + "/bin/" + base + std::to_string(::getpid());
        std::filesystem::copy_file(program, copy);
        programs_.push_back(copy);
        return copy;
    }
    // A copy of `program` registered as the application `id`; answers its path.
    std::string AddPeer(const std::string& id, const std::string& program,
                        const std::string& base) {
        const std::string copy = CopyProgram(program, base);
        Register("Software\\K-Lume\\ChromaLink\\Applications", id.c_str(), copy);
        return copy;
    }
    // A copy of lumaserver that registered itself as LumaServer; answers its path.
    std::string AddServer(const std::string& base = "lumaserver") {
        const std::string copy = CopyProgram(NXBASE_BINARY_DIR "/tools/lumaserver", base);
        EXPECT_EQ(std::system((copy + " --register >/dev/null").c_str()), 0) << copy;
        return copy;
    }
    // Ends the copies still running, as the sandbox does when it goes, and
    // reaps the test's ended children. A peer left running would hold the
    // test's output open.
    void EndPrograms() const {
        const auto running = [this] {
            bool any = false;
            for (const std::string& program : programs_) {
                for (pid_t pid : ProcessesNamed(program)) any = ::kill(pid, SIGKILL) == 0 || any;
            }
            return any;
        };
        WaitFor([&] { return !running(); });
        while (::waitpid(-1, nullptr, WNOHANG) > 0) {
        }
    }

    // A private D-Bus session bus at <root>/bus, the process's session bus
    // from then on (never the user's). StopBus kills it, as a logout does;
    // StartBus brings it back at the same address. False without dbus-daemon.
    bool StartBus() {
        if (::access("/usr/bin/dbus-daemon", X_OK) != 0) return false;
        const std::string socket = root_ + "/bus";
        std::filesystem::remove(socket);
        const std::string address = "--address=unix:path=" + socket;
        bus_ = ::fork();
        if (bus_ == 0) {
            ::execl("/usr/bin/dbus-daemon", "dbus-daemon", "--session", "--nofork", address.c_str(),
                    nullptr);
            ::_exit(127);
        }
        if (!busSet_) Env("DBUS_SESSION_BUS_ADDRESS", "unix:path=" + socket);
        busSet_ = true;
        return WaitFor([&] { return std::filesystem::exists(socket); });
    }
    void StopBus() {
        if (bus_ <= 0) return;
        ::kill(bus_, SIGKILL);
        ::waitpid(bus_, nullptr, 0);
        bus_ = -1;
    }
    bool BusRunning() const { return bus_ > 0; }

  private:
    std::string root_;
    std::vector<std::unique_ptr<ScopedEnv>> env_;
    std::vector<std::string> programs_;
    pid_t bus_ = -1;
    bool busSet_ = false;
};

}  // namespace nxtest

#endif  // NXBASE_TESTS_MESSAGING_TEST_UTIL_H_
