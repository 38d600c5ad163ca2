// Starting peer processes and keeping track of them: spawn in a directory,
// reap what was started (whichever transport started it), and wait for a
// started process to become reachable without blocking the event loop.
// Everything here runs on the event-loop thread.
#ifndef TOOLKIT_PROCESS_H_
#define TOOLKIT_PROCESS_H_

#include <sys/types.h>

#include <chrono>
#include <functional>
#include <string>
#include <vector>

#include "nxbase/export.h"

namespace toolkit {

// Starts `arguments[0]` with `arguments` in `directory` (posix_spawn; the
// environment and descriptors 0 to 2 are inherited, no other). The process id, or -1 with `error`
// set.
NXBASE_EXPORT pid_t SpawnProcess(const std::vector<std::string>& arguments,
                                 const std::string& directory, std::string& error);

// Collects every started process that has ended, so none stays a zombie.
NXBASE_EXPORT void ReapStartedProcesses();
// Whether started process `pid` has ended; `status` then says how
// ("exited with status 3", "killed by signal 9"). A process that was reaped
// earlier counts as ended with status "ended".
NXBASE_EXPORT bool StartedProcessEnded(pid_t pid, std::string& status);

// How a wait for a started process ended.
enum class StartWait { kReady, kExited, kGivenUp, kTimedOut };

// Runs the event loop (Application::RunUntil) until `ready()` is true, the
// started process `pid` ends, `keepWaiting()` (if set) says stop, Quit() is
// called (kGivenUp) or `deadline` passes. `keepWaiting` is asked at least
// every 50 ms, `ready` at growing intervals from 2 ms to 50 ms. `why` says
// what ended a wait that did not succeed.
NXBASE_EXPORT StartWait WaitForStartedProcess(pid_t pid, const std::function<bool()>& ready,
                                              const std::function<bool()>& keepWaiting,
                                              std::chrono::steady_clock::time_point deadline,
                                              std::string& why);

}  // namespace toolkit

#endif  // TOOLKIT_PROCESS_H_
