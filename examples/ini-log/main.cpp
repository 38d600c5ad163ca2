// An application's settings in an INI file and its process log: the log
// file and the keys it writes come from the settings, every step is logged,
// and the settings are written back.
//
//   ini-log DIRECTORY    settings.ini and the log go into DIRECTORY
#include <nxbase/configuration.h>
#include <nxbase/logfile.h>

#include <cstdio>
#include <fstream>
#include <iostream>
#include <string>

int main(int argc, char** argv) {
    if (argc != 2) {
        std::fprintf(stderr, "usage: %s DIRECTORY\n", argv[0]);
        return 2;
    }
    const std::string directory = argv[1];
    IniConfig settings(directory + "/settings.ini");

    // The log goes where the settings say (a path set before the log is
    // made), and writes the keys the settings switch on.
    const std::string logPath = settings.ReadKey("Log", "Path", directory + "/example.log");
    ::setenv("NXBASE_LOG_PATH", logPath.c_str(), 1);
    LogFile::CreateLogFile("ini-log");
    boost::shared_ptr<LogFile> log = LogFile::Instance();
    log->SetLogOption("Measure", settings.ReadKey("Log", "Measure", "1") == "1");

    {
        AutoLog run("calibration", "Measure");  // "calibration" begins ... ends, timed
        const int runs = std::stoi(settings.ReadKey("Measure", "Runs", "0")) + 1;
        run.Log("white tile read, run " + std::to_string(runs));
        settings.WriteKey("Measure", "Runs",
                          std::to_string(runs));  // written at once, as a whole file
        LogFile::WriteToLog("a line under a key that is off is not written", "Quiet");
    }
    settings.WriteKey("Log", "Path", logPath);

    std::cout << "settings " << settings.GetPath() << ":\n"
              << std::ifstream(settings.GetPath()).rdbuf();
    std::cout << "log " << log->GetFileName() << ":\n" << std::ifstream(log->GetFileName()).rdbuf();
    return 0;
}
