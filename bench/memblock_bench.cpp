// Streaming one million mixed values (char, short, int, long, String) through
// a memory block, against memcpy of the same byte image into a buffer of the
// final size, in the same program.
#include <benchmark/benchmark.h>

#include <cstring>
#include <string>
#include <vector>

#include "interleaved.h"
#include "nxbase/mymemblo.h"

namespace {

constexpr int kRecords = 200000;  // five values each: one million values
constexpr int kValuesPerRecord = 5;
const char kName[] = "D50/2";  // 5 characters and the zero byte
constexpr long kRecordBytes = 1 + 2 + 4 + 4 + sizeof kName;

void WriteBlock(MyMemoryBlock& block, const String& name) {
    for (int i = 0; i < kRecords; ++i) {
        block << static_cast<char>(i) << static_cast<short>(i) << i << static_cast<long>(-i)
              << name;
    }
}

// A fresh block of the default size: the doublings and the fresh pages they
// touch are part of the cost.
void BM_MemoryBlockWriteFresh(benchmark::State& state) {
    const String name(kName);
    for (auto _ : state) {
        MyMemoryBlock block;
        WriteBlock(block, name);
        benchmark::DoNotOptimize(block.GetDatenZeiger());
    }
    state.SetItemsProcessed(state.iterations() * kRecords * kValuesPerRecord);
    state.SetBytesProcessed(state.iterations() * kRecords * kRecordBytes);
}

// One block rewound for every pass, like the memcpy buffer below.
void BM_MemoryBlockWrite(benchmark::State& state) {
    const String name(kName);
    MyMemoryBlock block;
    block.RememberWritePointer();  // the start
    for (auto _ : state) {
        block.RestoreWritePointer();
        WriteBlock(block, name);
        benchmark::DoNotOptimize(block.GetDatenZeiger());
    }
    state.SetItemsProcessed(state.iterations() * kRecords * kValuesPerRecord);
    state.SetBytesProcessed(state.iterations() * kRecords * kRecordBytes);
}

void BM_MemoryBlockRead(benchmark::State& state) {
    MyMemoryBlock block;
    WriteBlock(block, String(kName));
    block.RememberReadPointer();  // the start
    for (auto _ : state) {
        block.RestoreReadPointer();
        char c;
        short s;
        int n;
        long l;
        String text;
        long sum = 0;
        for (int i = 0; i < kRecords; ++i) {
            block >> c >> s >> n >> l >> text;
            sum += c + s + n + l + text.Len();
        }
        benchmark::DoNotOptimize(sum);
    }
    state.SetItemsProcessed(state.iterations() * kRecords * kValuesPerRecord);
    state.SetBytesProcessed(state.iterations() * kRecords * kRecordBytes);
}

// The floor: the same bytes copied value by value into a buffer of the final
// size (host order, which is the block's order on this machine).
void BM_MemcpyWrite(benchmark::State& state) {
    std::vector<char> buffer(static_cast<std::size_t>(kRecords * kRecordBytes));
    for (auto _ : state) {
        char* p = buffer.data();
        for (int i = 0; i < kRecords; ++i) {
            char c = static_cast<char>(i);
            short s = static_cast<short>(i);
            int n = i;
            int l = -i;
            std::memcpy(p, &c, 1);
            std::memcpy(p + 1, &s, 2);
            std::memcpy(p + 3, &n, 4);
            std::memcpy(p + 7, &l, 4);
            std::memcpy(p + 11, kName, sizeof kName);
            p += kRecordBytes;
        }
        benchmark::DoNotOptimize(buffer.data());
        benchmark::ClobberMemory();
    }
    state.SetItemsProcessed(state.iterations() * kRecords * kValuesPerRecord);
    state.SetBytesProcessed(state.iterations() * kRecords * kRecordBytes);
}

void BM_MemcpyRead(benchmark::State& state) {
    MyMemoryBlock block;
    WriteBlock(block, String(kName));
    const char* data = block.GetDatenZeiger();
    for (auto _ : state) {
        const char* p = data;
        char c;
        short s;
        int n, l;
        std::string text;
        long sum = 0;
        for (int i = 0; i < kRecords; ++i) {
            std::memcpy(&c, p, 1);
            std::memcpy(&s, p + 1, 2);
            std::memcpy(&n, p + 3, 4);
            std::memcpy(&l, p + 7, 4);
            text.assign(p + 11, std::strlen(p + 11));
            p += kRecordBytes;
            sum += c + s + n + l + static_cast<long>(text.size());
        }
        benchmark::DoNotOptimize(sum);
    }
    state.SetItemsProcessed(state.iterations() * kRecords * kValuesPerRecord);
    state.SetBytesProcessed(state.iterations() * kRecords * kRecordBytes);
}

}  // namespace

int main(int argc, char** argv) {
    const std::vector<nxbench::Pair> pairs = {
        {"MemoryBlockWriteFresh_vs_MemcpyWrite", BM_MemcpyWrite, BM_MemoryBlockWriteFresh, false},
        {"MemoryBlockWrite_vs_MemcpyWrite", BM_MemcpyWrite, BM_MemoryBlockWrite, false},
        {"MemoryBlockRead_vs_MemcpyRead", BM_MemcpyRead, BM_MemoryBlockRead, false},
    };
    return nxbench::RunPairs(argc, argv, pairs, "pass of one million values");
}
