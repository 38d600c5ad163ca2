// nxdemo: the foundation at work. Several threads write keyed lines inside
// nested AutoLog blocks into one log, a measurement record travels through a
// memory block and back, then the log is printed.
#include <cstdio>
#include <iostream>
#include <string>
#include <thread>
#include <vector>

#include "nxbase/logfile.h"
#include "nxbase/mymemblo.h"
#include "nxbase/singleton.h"
#include "nxbase/thread.h"
#include "toolkit/system.h"

namespace {

constexpr int kWorkers = 3;
constexpr int kLinesPerWorker = 4;

// A worker thread of the library's Thread class writing under its own key.
class Measurer : public Thread {
  public:
    explicit Measurer(int number)
        : Thread("measurer-" + std::to_string(number), NORMAL_PRIORITY), number_(number) {}

  protected:
    unsigned int Run() override {
        String key = number_ == 2 ? "Quiet" : "Measure";
        for (int i = 0; i < kLinesPerWorker && !IsStopRequested(); ++i) {
            LogFile::WriteToLog(String("measurer ") + String::CreateFromInt(number_) + " sample " +
                                    String::CreateFromInt(i),
                                key);
        }
        return 0;
    }

  private:
    int number_;
};

// Packs a record the way messages carry it, copies the block (the copy reads
// from its start) and logs what comes out of the copy.
void RoundTripRecord() {
    AutoLog block("memory block", "Measure");
    FlagSet channels(4);
    channels.SetFlag(0);
    channels.SetFlag(2);
    MyMemoryBlock out;
    out << String("patch A1") << 36 << static_cast<short>(-12) << channels;
    out.Minimize();
    MyMemoryBlock copy(out);
    String id;
    int samples = 0;
    short offset = 0;
    FlagSet readChannels;
    copy >> id >> samples >> offset >> readChannels;
    block.Log(String("wrote ") + String::CreateFromInt(out.Len()) + " bytes, read back \"" + id +
              "\", " + String::CreateFromInt(samples) + " samples, offset " +
              String::CreateFromInt(offset) + ", " +
              String::CreateFromInt(readChannels.CountSet()) + " of " +
              String::CreateFromInt(readChannels.Count()) + " channels" +
              (copy.ReadPastEnd() || readChannels != channels ? " (MISMATCH)" : ""));
}

}  // namespace

int main() {
    std::string logPath = toolkit::TempDirectory() + "/nxdemo-" + std::to_string(::getpid());
    ::setenv("NXBASE_LOG_PATH", (logPath + ".log").c_str(), 1);
    LogFile::CreateLogFile("nxdemo");
    boost::shared_ptr<LogFile> log = LogFile::Instance();
    log->SetLogOption("Measure", true);
    log->SetLogOption("Keys", true);
    log->SetLogOption("Startup", true);

    {
        AutoLog run("demo run", "Measure");
        std::vector<std::unique_ptr<Measurer>> workers;
        for (int n = 0; n < kWorkers; ++n) {
            workers.push_back(std::make_unique<Measurer>(n));
            workers.back()->StartThread();
        }
        for (auto& worker : workers) worker->KillThread();
        RoundTripRecord();
        AutoLog summary("summary", "Measure");
        summary.Log("key \"Quiet\" is announced but not written");
    }
    NxSingleton::DeleteAllSingleton();

    std::cout << "Log file " << log->GetFileName() << ":\n";
    std::FILE* file = std::fopen(log->GetFileName().c_str(), "r");
    if (file == nullptr) return 1;
    char line[512];
    while (std::fgets(line, sizeof line, file)) std::cout << line;
    std::fclose(file);
    return 0;
}
