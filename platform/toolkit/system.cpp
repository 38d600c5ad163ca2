#include "toolkit/system.h"

#include <pthread.h>
#include <pwd.h>
#include <sys/ioctl.h>
#include <sys/resource.h>
#include <sys/stat.h>
#include <sys/syscall.h>
#include <sys/utsname.h>
#include <unistd.h>

#include <algorithm>
#include <atomic>
#include <cerrno>
#include <climits>
#include <cstdio>
#include <cstdlib>
#include <cstring>
#include <ctime>
#include <vector>

namespace toolkit {

void LocalNow(Date& date, Time& time) {
    std::time_t now = std::time(nullptr);
    std::tm local{};
    localtime_r(&now, &local);
    date.day = local.tm_mday;
    date.month = local.tm_mon + 1;
    date.year = local.tm_year + 1900;
    time.hour = local.tm_hour;
    time.minute = local.tm_min;
    time.second = local.tm_sec;
}

std::string TempDirectory() {
    const char* tmp = std::getenv("TMPDIR");
    std::string dir = (tmp && *tmp) ? tmp : "/tmp";
    while (dir.size() > 1 && dir.back() == '/') dir.pop_back();
    return dir;
}

std::string ExecutableFileName() {
    std::vector<char> buffer(4096);
    ssize_t n = readlink("/proc/self/exe", buffer.data(), buffer.size() - 1);
    if (n <= 0) return std::string();
    return std::string(buffer.data(), static_cast<std::size_t>(n));
}

std::uint32_t CurrentThreadId() {
    return static_cast<std::uint32_t>(syscall(SYS_gettid));
}

std::uint32_t EffectiveUserId() {
    return static_cast<std::uint32_t>(::geteuid());
}

std::string KernelRelease() {
    utsname name{};
    return ::uname(&name) == 0 ? std::string(name.release) : std::string();
}

std::string HostName() {
    char buffer[HOST_NAME_MAX + 1] = {};
    return ::gethostname(buffer, HOST_NAME_MAX) == 0 ? std::string(buffer) : std::string();
}

std::string LoginName() {
    char buffer[LOGIN_NAME_MAX + 1] = {};
    if (::getlogin_r(buffer, sizeof buffer) == 0 && buffer[0] != '\0') return buffer;
    std::vector<char> storage(16384);
    passwd entry{};
    passwd* found = nullptr;
    if (::getpwuid_r(::getuid(), &entry, storage.data(), storage.size(), &found) == 0 && found &&
        found->pw_name != nullptr)
        return found->pw_name;
    return std::string();
}

unsigned int OnlineProcessorCount() {
    const long count = ::sysconf(_SC_NPROCESSORS_ONLN);
    return count > 0 ? static_cast<unsigned int>(count) : 1u;
}

VectorIsa MachineVectorIsa() {
#if defined(__x86_64__) && defined(__GNUC__)
#ifdef __clang__
    // Clang 14 knows no level names; these are the parts of x86-64-v3 it can ask for.
    const bool level3 = __builtin_cpu_supports("avx2") && __builtin_cpu_supports("fma") &&
                        __builtin_cpu_supports("bmi") && __builtin_cpu_supports("bmi2") &&
                        __builtin_cpu_supports("popcnt");
#else
    const bool level3 = __builtin_cpu_supports("x86-64-v3");
#endif
    if (!level3) return VectorIsa::kBaseline;
    if (__builtin_cpu_supports("avx512f") && __builtin_cpu_supports("avx512dq") &&
        __builtin_cpu_supports("avx512vl"))
        return VectorIsa::kAvx512;
    return VectorIsa::kAvx2;
#else
    return VectorIsa::kBaseline;
#endif
}

int ProcessNiceValue() {
    errno = 0;
    const int nice = ::getpriority(PRIO_PROCESS, static_cast<id_t>(::getpid()));
    return nice == -1 && errno != 0 ? 0 : nice;
}

bool SetThreadNiceValue(std::uint32_t threadId, int nice) {
    return ::setpriority(PRIO_PROCESS, static_cast<id_t>(threadId), nice) == 0;
}

bool IsTerminal(int fd) {
    return ::isatty(fd) == 1;
}

std::size_t TerminalColumns(int fd) {
    struct winsize size {};
    return ::ioctl(fd, TIOCGWINSZ, &size) == 0 ? size.ws_col : 0;
}

std::string EnsurePrivateDirectory(const std::string& path) {
    if (path.empty()) return "no directory name";
    // Parents are made as needed (mode 0700 too); each must end up a directory.
    for (std::size_t slash = path.find('/', 1); slash != std::string::npos;
         slash = path.find('/', slash + 1)) {
        std::string parent = path.substr(0, slash);
        if (::mkdir(parent.c_str(), 0700) != 0 && errno != EEXIST) {
            return "cannot create " + parent + ": " + std::strerror(errno);
        }
    }
    if (::mkdir(path.c_str(), 0700) != 0 && errno != EEXIST) {
        return "cannot create " + path + ": " + std::strerror(errno);
    }
    struct stat info {};
    if (::lstat(path.c_str(), &info) != 0) return path + ": " + std::strerror(errno);
    if (S_ISLNK(info.st_mode)) return path + " is a symbolic link";
    if (!S_ISDIR(info.st_mode)) return path + " is not a directory";
    if (info.st_uid != ::geteuid()) {
        return path + " belongs to user id " + std::to_string(info.st_uid);
    }
    if ((info.st_mode & 077) != 0) {
        char mode[8];
        std::snprintf(mode, sizeof mode, "%04o", static_cast<unsigned>(info.st_mode & 07777));
        return path + " is open to other users (mode " + mode + ")";
    }
    return std::string();
}

std::string UserTempDirectory(std::string* refusal) {
    std::string base = TempDirectory() + "/k-lume-" + std::to_string(::geteuid());
    std::string reason = EnsurePrivateDirectory(base);
    if (reason.empty()) return base;
    if (refusal) *refusal = reason;
    // Someone else holds the usual name: a fresh directory only we can own.
    std::string pattern = base + "-XXXXXX";
    std::vector<char> buffer(pattern.begin(), pattern.end());
    buffer.push_back('\0');
    if (::mkdtemp(buffer.data()) == nullptr) return std::string();
    return std::string(buffer.data());
}

std::string NormalizePath(const std::string& path) {
    std::string result(path);
    std::replace(result.begin(), result.end(), '\\', '/');
    return result;
}

namespace {
std::atomic<unsigned> gForkGeneration{0};
// A handler may do no more than this in the child; registered as the library loads.
const int kForkHandler = ::pthread_atfork(
    nullptr, nullptr, [] { gForkGeneration.fetch_add(1, std::memory_order_relaxed); });
}  // namespace

unsigned ForkGeneration() {
    return gForkGeneration.load(std::memory_order_relaxed);
}

}  // namespace toolkit

Date Date::Today() {
    Date date;
    Time time;
    toolkit::LocalNow(date, time);
    return date;
}

Time Time::Now() {
    Date date;
    Time time;
    toolkit::LocalNow(date, time);
    return time;
}
