// Reading a 50 MB ASCII data file of measurement records, against the floor
// of reading the same file into memory in the same process. The file was just
// written, so both read it from the page cache, not from the disk: the
// figures are parsing cost, not I/O. Writing is measured with checks after
// every record, every 100 records and never against one check at the end.
// Every pair runs in interleaved rounds.
#include <benchmark/benchmark.h>
#include <fcntl.h>
#include <unistd.h>

#include <cmath>
#include <cstdio>
#include <filesystem>
#include <sstream>
#include <vector>

#include "interleaved.h"
#include "nxbase/asciifile.h"
#include "test_util.h"

namespace {

constexpr std::size_t kTargetBytes = 50u << 20;
constexpr int kSpectrumPoints = 36;
constexpr int kDensityChannels = 4;
constexpr int kDecimals = 5;

// One measured patch, as a spectrophotometer application stores it.
struct Record {
    String name;
    int date[6];
    double spectrum[kSpectrumPoints];
    double lab[3];
    short density[kDensityChannels];
    int counts[kSpectrumPoints];
    bool valid;
};

Record MakeRecord(int index) {
    Record r;
    char name[64];
    std::snprintf(name, sizeof name, "Patch %05d row %c col %d", index, 'A' + index % 26,
                  index % 40);
    r.name = name;
    int date[6] = {1 + index % 28, 1 + index % 12, 2026, index % 24, index % 60, (index * 7) % 60};
    std::copy(date, date + 6, r.date);
    for (int i = 0; i < kSpectrumPoints; ++i) {
        double nm = 380.0 + 10.0 * i;
        r.spectrum[i] = 0.05 + 0.85 / (1.0 + std::exp(-(nm - 500.0 - index % 150) / 25.0));
        r.counts[i] = 1000 + (index * 37 + i * 1013) % 60000;
    }
    r.lab[0] = 20.0 + index % 80 + 0.123;
    r.lab[1] = -40.0 + index % 80 + 0.456;
    r.lab[2] = -30.0 + index % 70 + 0.789;
    for (int i = 0; i < kDensityChannels; ++i) {
        r.density[i] = static_cast<short>((index * 13 + i * 311) % 2500);
    }
    r.valid = index % 17 != 0;
    return r;
}

void WriteRecord(ASCIIFile& file, const Record& r) {
    file.PutTitel("Measurement");
    file.PutString("Name", r.name);
    file.PutDate("Date", r.date[0], r.date[1], r.date[2], r.date[3], r.date[4], r.date[5]);
    file.PutBOOL("Valid", r.valid);
    file.PutString("Device", String("LumaSpec 3000, SN 104-2231"));
    file.PutInt("Points", kSpectrumPoints);
    file.PutRealArray("Spectrum", r.spectrum, kSpectrumPoints, kDecimals);
    file.PutRealArray("Lab", r.lab, 3, kDecimals);
    file.PutShortArray("Density", r.density, kDensityChannels);
    file.PutIntArray("Counts", r.counts, kSpectrumPoints);
}

// Reads one record; false at the end of the file or on a mismatch.
bool ReadRecord(ASCIIFile& file, Record& r) {
    int points = 0;
    return file.GetTitel("Measurement") && file.GetString("Name", r.name) &&
           file.GetDate("Date", r.date[0], r.date[1], r.date[2], r.date[3], r.date[4], r.date[5]) &&
           file.GetBOOL("Valid", r.valid) && file.GetString("Device", r.name) &&
           file.GetInt("Points", points) &&
           file.GetRealArray("Spectrum", r.spectrum, kSpectrumPoints) &&
           file.GetRealArray("Lab", r.lab, 3) &&
           file.GetShortArray("Density", r.density, kDensityChannels) &&
           file.GetIntArray("Counts", r.counts, kSpectrumPoints);
}

// The data file, written once per process.
struct DataFile {
    nxtest::TempDir dir;
    std::string path = dir.File("measurements.dat");
    std::size_t bytes = 0;
    int records = 0;

    DataFile() {
        std::vector<Record> patterns;
        for (int i = 0; i < 1000; ++i) patterns.push_back(MakeRecord(i));
        std::stringstream batch;
        {
            ASCIIFileImpl sizer(&batch, false);
            for (const Record& r : patterns) WriteRecord(sizer, r);
        }
        std::size_t batchBytes = batch.str().size();
        {
            auto file = ASCIIFile::Get(String(path), false);
            for (std::size_t written = 0; written < kTargetBytes; written += batchBytes) {
                for (const Record& r : patterns) WriteRecord(*file, r);
                records += 1000;
            }
        }
        bytes = std::filesystem::file_size(path);
    }
};

DataFile& TheFile() {
    static DataFile file;
    return file;
}

void BM_PlainRead_PageCache_Baseline(benchmark::State& state) {
    DataFile& data = TheFile();
    std::vector<char> buffer(data.bytes);
    for (auto _ : state) {
        int fd = ::open(data.path.c_str(), O_RDONLY | O_CLOEXEC);
        std::size_t have = 0;
        while (have < buffer.size()) {
            ssize_t n = ::read(fd, buffer.data() + have, buffer.size() - have);
            if (n <= 0) break;
            have += static_cast<std::size_t>(n);
        }
        ::close(fd);
        benchmark::DoNotOptimize(buffer.data());
        if (have != data.bytes) state.SkipWithError("short read");
    }
    state.SetBytesProcessed(static_cast<int64_t>(state.iterations() * data.bytes));
}

void BM_ReadMeasurementRecords_PageCache(benchmark::State& state) {
    DataFile& data = TheFile();
    Record record;
    for (auto _ : state) {
        auto file = ASCIIFile::Get(String(data.path), true);
        int count = 0;
        while (ReadRecord(*file, record)) ++count;
        if (count != data.records) state.SkipWithError("records lost");
        benchmark::DoNotOptimize(record.spectrum[0]);
    }
    state.SetBytesProcessed(static_cast<int64_t>(state.iterations() * data.bytes));
    state.counters["records"] = data.records;
}

// Writing records by name with a CheckOutError after every record, after
// every 100 records, and never (the destructor alone hands the lines over),
// against one check at the end (the baseline), into a new file of about 1 MB
// and of about 100 MB. The destructor syncs the file to the disk in every
// case, so each side pays one fsync of the same bytes.
struct WriteCase {
    const char* size;
    std::size_t bytes;
    const char* checks;
    int every;  // records per check; 0: only at the end; -1: never
};

constexpr std::size_t kRecordBytesEstimate = 700;
constexpr int kRounds = 5;

void WriteRecordsChecking(benchmark::State& state, std::size_t bytes, int every) {
    static const std::vector<Record> patterns = [] {
        std::vector<Record> made;
        for (int i = 0; i < 1000; ++i) made.push_back(MakeRecord(i));
        return made;
    }();
    nxtest::TempDir dir;
    const std::string path = dir.File("written.dat");
    const int records = static_cast<int>(bytes / kRecordBytesEstimate);
    for (auto _ : state) {
        auto file = ASCIIFile::Get(String(path), false);
        for (int i = 0; i < records; ++i) {
            WriteRecord(*file, patterns[static_cast<std::size_t>(i) % patterns.size()]);
            if (every > 0 && (i + 1) % every == 0) file->CheckOutError();
        }
        if (every >= 0) {
            file->CheckOutError();
            if (file->GetError()) state.SkipWithError("write failed");
        }
    }
    if (std::filesystem::file_size(path) < bytes / 2) state.SkipWithError("records lost");
    state.SetBytesProcessed(static_cast<int64_t>(state.iterations()) *
                            static_cast<int64_t>(std::filesystem::file_size(path)));
}

std::vector<nxbench::Pair> Pairs() {
    std::vector<nxbench::Pair> pairs = {
        {"ReadMeasurementRecords_vs_PlainRead_PageCache", BM_PlainRead_PageCache_Baseline,
         BM_ReadMeasurementRecords_PageCache, false},
    };
    static const WriteCase cases[] = {
        {"1MB", 1u << 20, "EveryRecord", 1},
        {"1MB", 1u << 20, "Every100Records", 100},
        {"1MB", 1u << 20, "Never", -1},
        {"100MB", 100u << 20, "EveryRecord", 1},
        {"100MB", 100u << 20, "Every100Records", 100},
        {"100MB", 100u << 20, "Never", -1},
    };
    for (const WriteCase& c : cases) {
        pairs.push_back(
            {std::string("WriteRecords") + c.size + "_Check" + c.checks + "_vs_CheckAtEnd",
             [c](benchmark::State& state) { WriteRecordsChecking(state, c.bytes, 0); },
             [c](benchmark::State& state) { WriteRecordsChecking(state, c.bytes, c.every); },
             false});
    }
    return pairs;
}

}  // namespace

int main(int argc, char** argv) {
    return nxbench::RunPairs(argc, argv, Pairs(), "run (each write ends with an fsync)", kRounds);
}
