// Runs one test program and, once it has ended, ends every process it left
// behind. Peers a test starts (servers started on demand, dbus-daemon) inherit
// its output; when the test crashes they would hold that output open, and
// ctest would wait for them until its time limit.
//
//   nxtest_launcher PROGRAM [ARG...]
//
// The launcher is its descendants' subreaper: orphans come to it instead of
// to init. It reaps them while the test runs (so that a test waiting for a
// process to go does not see a zombie), kills what is left once the test has
// ended, and ends as the test did.
#include <dirent.h>
#include <fcntl.h>
#include <signal.h>
#include <sys/prctl.h>
#include <sys/wait.h>
#include <unistd.h>

#include <cerrno>
#include <chrono>
#include <cstdio>
#include <cstdlib>
#include <string>
#include <thread>
#include <vector>

namespace {

volatile sig_atomic_t testPid = 0;

void ForwardToTest(int signal) {
    if (testPid > 0) ::kill(testPid, signal);
}

// The parent pid in /proc/PID/stat: the field after the command, which is
// in parentheses and may itself hold spaces and parentheses. 0 when the
// process is gone (it may go between the listing and the read).
pid_t ParentOf(const std::string& pid) {
    const int fd = ::open(("/proc/" + pid + "/stat").c_str(), O_RDONLY | O_CLOEXEC);
    if (fd < 0) return 0;
    char buffer[1024];
    const ssize_t got = ::read(fd, buffer, sizeof buffer - 1);
    ::close(fd);
    if (got <= 0) return 0;
    const std::string stat(buffer, static_cast<std::size_t>(got));
    const std::size_t end = stat.rfind(')');
    if (end == std::string::npos || end + 4 >= stat.size()) return 0;
    return static_cast<pid_t>(std::atol(stat.c_str() + end + 4));
}

std::vector<pid_t> Children() {
    std::vector<pid_t> children;
    DIR* proc = ::opendir("/proc");
    if (proc == nullptr) return children;
    const pid_t self = ::getpid();
    while (dirent* entry = ::readdir(proc)) {
        std::string name = entry->d_name;
        if (name.find_first_not_of("0123456789") != std::string::npos) continue;
        if (ParentOf(name) == self) children.push_back(static_cast<pid_t>(std::atol(name.c_str())));
    }
    ::closedir(proc);
    return children;
}

// Reaps children until the test itself has ended; answers its wait status.
int WaitForTest(pid_t test) {
    for (;;) {
        int status = 0;
        pid_t ended = ::waitpid(-1, &status, 0);
        if (ended == test) return status;
        if (ended < 0 && errno != EINTR) return W_EXITCODE(127, 0);
    }
}

// Kills the processes left behind, and those that come to this process as
// their parents die, until none is left; answers how many were killed.
int EndLeftovers() {
    int killed = 0;
    const auto giveUp = std::chrono::steady_clock::now() + std::chrono::seconds(10);
    for (;;) {
        while (::waitpid(-1, nullptr, WNOHANG) > 0) {
        }
        std::vector<pid_t> left = Children();
        if (left.empty() || std::chrono::steady_clock::now() > giveUp) return killed;
        for (pid_t pid : left) {
            if (::kill(pid, SIGKILL) == 0) ++killed;
        }
        std::this_thread::sleep_for(std::chrono::milliseconds(5));
    }
}

}  // namespace

int main(int argc, char** argv) {
    if (argc < 2) {
        std::fprintf(stderr, "usage: %s PROGRAM [ARG...]\n", argv[0]);
        return 2;
    }
    ::prctl(PR_SET_CHILD_SUBREAPER, 1);
    pid_t test = ::fork();
    if (test < 0) {
        std::perror("fork");
        return 127;
    }
    if (test == 0) {
        ::execv(argv[1], argv + 1);
        std::perror(argv[1]);
        ::_exit(127);
    }
    testPid = test;
    for (int signal : {SIGTERM, SIGINT, SIGHUP, SIGQUIT}) ::signal(signal, ForwardToTest);

    const int status = WaitForTest(test);
    testPid = 0;
    if (int killed = EndLeftovers())
        std::fprintf(stderr, "nxtest_launcher: ended %d process(es) the test left behind\n",
                     killed);
    if (WIFSIGNALED(status)) {
        ::signal(WTERMSIG(status), SIG_DFL);
        ::raise(WTERMSIG(status));
    }
    return WIFEXITED(status) ? WEXITSTATUS(status) : 1;
}
