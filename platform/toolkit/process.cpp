#include "toolkit/process.h"

#include <signal.h>
#include <spawn.h>
#include <sys/syscall.h>
#include <sys/wait.h>
#include <unistd.h>

#include <algorithm>
#include <boost/asio/posix/stream_descriptor.hpp>
#include <cerrno>
#include <cstring>
#include <map>
#include <memory>

#include "toolkit/application.h"

extern char** environ;

namespace toolkit {

namespace {

// Started processes still running (value empty) or ended (how).
std::map<pid_t, std::string>& Started() {
    static std::map<pid_t, std::string> started;
    return started;
}

std::string DescribeStatus(int status) {
    if (WIFEXITED(status)) return "exited with status " + std::to_string(WEXITSTATUS(status));
    if (WIFSIGNALED(status)) return "killed by signal " + std::to_string(WTERMSIG(status));
    return "ended";
}

// Ended processes are remembered for a while so that a waiter can say how
// they ended; the oldest are forgotten first.
constexpr std::size_t kEndedKept = 64;

void Forget() {
    auto& started = Started();
    std::size_t ended = 0;
    for (const auto& entry : started) ended += entry.second.empty() ? 0 : 1;
    for (auto at = started.begin(); ended > kEndedKept && at != started.end();) {
        if (at->second.empty()) {
            ++at;
            continue;
        }
        at = started.erase(at);
        --ended;
    }
}

// A started process's pidfd becomes readable when it ends, so it is reaped
// then, without a periodic check that would wake an idle application. A
// kernel without pidfds leaves the reaping to the next explicit call.
void ReapWhenEnded(pid_t pid) {
    int descriptor = static_cast<int>(::syscall(SYS_pidfd_open, pid, 0));
    if (descriptor < 0) return;
    auto watch = std::make_shared<boost::asio::posix::stream_descriptor>(
        Application::Get().GetContext(), descriptor);
    watch->async_wait(boost::asio::posix::stream_descriptor::wait_read,
                      [watch](const boost::system::error_code&) { ReapStartedProcesses(); });
}

}  // namespace

pid_t SpawnProcess(const std::vector<std::string>& arguments, const std::string& directory,
                   std::string& error) {
    if (arguments.empty()) {
        error = "nothing to start";
        return -1;
    }
    std::vector<std::string> copies(arguments);
    std::vector<char*> argv;
    for (std::string& argument : copies) argv.push_back(argument.data());
    argv.push_back(nullptr);
    posix_spawn_file_actions_t actions;
    posix_spawn_file_actions_init(&actions);
    if (!directory.empty()) posix_spawn_file_actions_addchdir_np(&actions, directory.c_str());
    // Only standard input, output and error: a started server holding one
    // of our channels would keep it open after we end.
    posix_spawn_file_actions_addclosefrom_np(&actions, 3);
    pid_t pid = -1;
    int result = ::posix_spawn(&pid, copies[0].c_str(), &actions, nullptr, argv.data(), environ);
    posix_spawn_file_actions_destroy(&actions);
    if (result != 0) {
        error = "cannot start " + copies[0] + ": " + std::strerror(result);
        return -1;
    }
    ReapStartedProcesses();
    Started()[pid] = std::string();
    ReapWhenEnded(pid);
    return pid;
}

void ReapStartedProcesses() {
    for (auto& [pid, how] : Started()) {
        if (!how.empty()) continue;
        int status = 0;
        pid_t result = ::waitpid(pid, &status, WNOHANG);
        if (result == pid) how = DescribeStatus(status);
        // Not ours to wait for (SIGCHLD ignored, or reaped elsewhere): it has
        // ended only when it no longer exists.
        if (result < 0 && errno == ECHILD && ::kill(pid, 0) != 0) how = "ended";
    }
    Forget();
}

bool StartedProcessEnded(pid_t pid, std::string& status) {
    ReapStartedProcesses();
    auto at = Started().find(pid);
    if (at == Started().end()) {
        status = "ended";
        return true;
    }
    status = at->second;
    return !status.empty();
}

StartWait WaitForStartedProcess(pid_t pid, const std::function<bool()>& ready,
                                const std::function<bool()>& keepWaiting,
                                std::chrono::steady_clock::time_point deadline, std::string& why) {
    using namespace std::chrono;
    constexpr milliseconds kLongestPause(50);
    // `ready` may connect: it is tried at growing intervals, whether the
    // process ended is looked at after every turn.
    std::string status;
    auto ended = [&] { return pid > 0 && StartedProcessEnded(pid, status); };
    for (milliseconds pause(2);; pause = std::min(pause * 2, kLongestPause)) {
        if (ready()) return StartWait::kReady;
        auto nextTry = std::min(steady_clock::now() + pause, deadline);
        switch (Application::Get().RunUntil(ended, keepWaiting, nextTry)) {
            case Application::WaitEnd::kReady:
                // It may have handed over to a process that is now reachable.
                if (ready()) return StartWait::kReady;
                why = "it " + status;
                return StartWait::kExited;
            case Application::WaitEnd::kQuit:
                why = "the application quits";
                return StartWait::kGivenUp;
            case Application::WaitEnd::kGivenUp:
                why = "the wait was given up";
                return StartWait::kGivenUp;
            case Application::WaitEnd::kTimedOut:
                if (steady_clock::now() < deadline) continue;
                if (ready()) return StartWait::kReady;
                why = "it did not become reachable in time";
                return StartWait::kTimedOut;
        }
    }
}

}  // namespace toolkit
