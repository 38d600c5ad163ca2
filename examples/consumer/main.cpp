// Uses the installed library: a logged line and a named lock.
#include <cstdio>

#include <nxbase/logfile.h>
#include <nxbase/thread.h>

int main() {
    CriticalSection section("ConsumerStart");
    LogFile::WriteToLog("consumer started", "");
    std::printf("consumer logged to %s\n", LogFile::Instance()->GetFileName().c_str());
    return 0;
}
