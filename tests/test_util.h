// Shared helpers for the NxBase tests: a temporary directory per test,
// scoped environment variables, reading files back.
#ifndef NXBASE_TESTS_TEST_UTIL_H_
#define NXBASE_TESTS_TEST_UTIL_H_

#include <gmock/gmock.h>
#include <signal.h>
#include <sys/resource.h>
#include <sys/wait.h>
#include <unistd.h>

#include <cerrno>
#include <chrono>
#include <cstdio>
#include <cstdlib>
#include <filesystem>
#include <fstream>
#include <functional>
#include <iterator>
#include <optional>
#include <sstream>
#include <string>
#include <string_view>
#include <system_error>
#include <vector>

#include "nxbase/logfile.h"

// Text checks read as what they check and print the whole text on failure.
using ::testing::HasSubstr;
using ::testing::Not;

namespace nxtest {

// A fresh directory below the system's temporary directory, removed again.
class TempDir {
  public:
    // For tests that act as a second user: when that user could not reach
    // the usual place (a checkout in a private home run by root), the
    // directory is made under /tmp instead, with a fresh unique name.
    enum class Reach { kOwnerOnly, kOtherUsers };

    explicit TempDir(Reach reach = Reach::kOwnerOnly) {
        std::filesystem::path base = std::filesystem::temp_directory_path();
        if (reach == Reach::kOtherUsers && !OthersCanTraverse(base)) base = "/tmp";
        std::string pattern = (base / "nxbase-test-XXXXXX").string();
        std::vector<char> buffer(pattern.begin(), pattern.end());
        buffer.push_back('\0');
        char* made = ::mkdtemp(buffer.data());
        path_ = made ? made : pattern;
    }
    ~TempDir() {
        std::error_code ignored;
        std::filesystem::remove_all(path_, ignored);
    }
    TempDir(const TempDir&) = delete;
    TempDir& operator=(const TempDir&) = delete;

    const std::filesystem::path& path() const { return path_; }
    std::string File(const std::string& name) const { return (path_ / name).string(); }

  private:
    // Every directory from the root down to `path` lets other users pass.
    static bool OthersCanTraverse(const std::filesystem::path& path) {
        std::error_code error;
        std::filesystem::path at = std::filesystem::absolute(path, error);
        for (; !at.empty(); at = at.parent_path()) {
            const auto permissions = std::filesystem::status(at, error).permissions();
            if (error || (permissions & std::filesystem::perms::others_exec) ==
                             std::filesystem::perms::none) {
                return false;
            }
            if (at == at.root_path()) break;
        }
        return true;
    }

    std::filesystem::path path_;
};

// Sets an environment variable for a scope and restores the old value.
class ScopedEnv {
  public:
    ScopedEnv(const char* name, const std::string& value) : name_(name) {
        if (const char* old = std::getenv(name)) old_ = old;
        ::setenv(name, value.c_str(), 1);
    }
    ~ScopedEnv() {
        if (old_) {
            ::setenv(name_.c_str(), old_->c_str(), 1);
        } else {
            ::unsetenv(name_.c_str());
        }
    }
    ScopedEnv(const ScopedEnv&) = delete;
    ScopedEnv& operator=(const ScopedEnv&) = delete;

  private:
    std::string name_;
    std::optional<std::string> old_;
};

inline std::string ReadFile(const std::string& path) {
    std::ifstream in(path, std::ios::binary);
    return std::string(std::istreambuf_iterator<char>(in), std::istreambuf_iterator<char>());
}

// What a shell command printed, standard error included, and its exit status
// (-1 when it did not exit).
struct ShellResult {
    int status = -1;
    std::string out;
};

inline ShellResult Shell(const std::string& command) {
    ShellResult result;
    FILE* pipe = ::popen((command + " 2>&1").c_str(), "r");
    if (pipe == nullptr) return result;
    char buffer[4096];
    for (std::size_t n; (n = std::fread(buffer, 1, sizeof buffer, pipe)) > 0;)
        result.out.append(buffer, n);
    const int status = ::pclose(pipe);
    result.status = WIFEXITED(status) ? WEXITSTATUS(status) : -1;
    return result;
}

// Runs `body` in a forked child that exits with the code it returns; one
// that throws prints what it threw and exits 125 (the child must never
// return into the test). Answers the child's id, never -1: a failed fork
// throws, so that no caller signals -1 (every process it may reach).
inline pid_t Fork(const std::function<int()>& body) {
    const pid_t pid = ::fork();
    if (pid < 0) throw std::system_error(errno, std::generic_category(), "fork");
    if (pid > 0) return pid;
    int code = 125;
    try {
        code = body();
    } catch (const std::exception& error) {
        std::fprintf(stderr, "child %d: %s\n", static_cast<int>(::getpid()), error.what());
    } catch (...) {
    }
    ::_exit(code);
}

// Waits for a child and answers its exit code, -1 when it did not exit.
inline int WaitExit(pid_t pid) {
    int status = 0;
    if (::waitpid(pid, &status, 0) != pid || !WIFEXITED(status)) return -1;
    return WEXITSTATUS(status);
}

// Runs `body` in a child process and answers its exit code.
inline int InChild(const std::function<int()>& body) {
    return WaitExit(Fork(body));
}

// In a child: becomes the unprivileged user "nobody" when running as root,
// for checks that root's rights would pass. False when that fails.
inline bool DropRoot() {
    return ::geteuid() != 0 || (::setgid(65534) == 0 && ::setuid(65534) == 0);
}

// In a child: files cannot grow beyond `bytes`; a write past it fails
// instead of raising SIGXFSZ.
inline void LimitFileSize(rlim_t bytes) {
    ::signal(SIGXFSZ, SIG_IGN);
    const rlimit limit{bytes, bytes};
    ::setrlimit(RLIMIT_FSIZE, &limit);
}

// Matches a ShellResult that exited with `status` and printed `part`; a
// failure shows the whole output.
MATCHER_P2(Exits, status, part, "exits " + ::testing::PrintToString(status)) {
    *result_listener << "exit status " << arg.status << ", output:\n" << arg.out;
    return arg.status == status && arg.out.find(part) != std::string::npos;
}

inline std::string ShellOutput(const std::string& command) {
    return Shell(command).out;
}

inline std::vector<std::string> ReadLines(const std::string& path) {
    std::vector<std::string> lines;
    std::istringstream in(ReadFile(path));
    for (std::string line; std::getline(in, line);) lines.push_back(line);
    return lines;
}

// The rows of a CSV file below its header, split at ",".
inline std::vector<std::vector<std::string>> ReadCsvRows(const std::string& path) {
    std::vector<std::vector<std::string>> rows;
    const std::vector<std::string> lines = ReadLines(path);
    for (std::size_t i = 1; i < lines.size(); ++i) {
        if (lines[i].empty()) continue;
        std::istringstream in(lines[i]);
        rows.emplace_back();
        for (std::string field; std::getline(in, field, ',');) rows.back().push_back(field);
    }
    return rows;
}

// Bytes as lower-case hexadecimal pairs.
inline std::string Hex(std::string_view bytes) {
    static const char kDigits[] = "0123456789abcdef";
    std::string hex;
    for (unsigned char c : bytes) hex += {kDigits[c >> 4], kDigits[c & 15]};
    return hex;
}

// Calls `step` until `done` or `limit`; false on the time-out. `step` runs
// an event loop for a moment, or only sleeps.
inline bool Until(const std::function<bool()>& done, std::chrono::milliseconds limit,
                  const std::function<void()>& step) {
    const auto deadline = std::chrono::steady_clock::now() + limit;
    while (!done()) {
        if (std::chrono::steady_clock::now() > deadline) return false;
        step();
    }
    return true;
}

// A keep-waiting function that says go on for `limit` from now.
inline std::function<bool()> For(std::chrono::milliseconds limit) {
    const auto until = std::chrono::steady_clock::now() + limit;
    return [until] { return std::chrono::steady_clock::now() < until; };
}

// Waits, without running any loop, until `done` or `limit`.
inline bool WaitFor(const std::function<bool()>& done,
                    std::chrono::milliseconds limit = std::chrono::seconds(5)) {
    return Until(done, limit, [] { ::usleep(10000); });
}

inline void WriteFile(const std::string& path, const std::string& bytes) {
    std::ofstream out(path, std::ios::binary | std::ios::trunc);
    out << bytes;
}

// A log listener that records every line it is given as "key|text".
class RecordingLog : public LogInterface {
  public:
    bool IsLogOptionEnabled(const String&) const override { return true; }
    void WriteLog(const String& text, const String& key) override {
        lines.push_back(key.str() + "|" + text.str());
    }
    void WriteStackTrace() override {}
    void UpdateInfo(const String&, const String&) override {}

    bool Contains(const std::string& line) const {
        for (const std::string& recorded : lines) {
            if (recorded == line) return true;
        }
        return false;
    }
    std::vector<std::string> lines;
};

}  // namespace nxtest

#endif  // NXBASE_TESTS_TEST_UTIL_H_
