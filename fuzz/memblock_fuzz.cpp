// Reads arbitrary bytes through the memory block readers. The first input
// byte gives the number of operation bytes that follow; the rest of the input
// is the block's content. Each operation byte picks a reader (or a copy,
// Minimize, remember/restore). Every value read in full must write back as
// exactly the bytes it was read from, and no reader may leave the data.
#include <cstdint>
#include <cstdlib>
#include <cstring>

#include "nxbase/mymemblo.h"

namespace {

void Require(bool axCondition) {
    if (!axCondition) std::abort();
}

void RequireInside(MyMemoryBlock& block) {
    Require(block.GetGetPointer() >= block.GetDatenZeiger());
    Require(block.GetGetPointer() <= block.GetPutPointer());
    Require(block.GetPutPointer() == block.GetDatenZeiger() + block.Len());
    Require(block.Len() <= block.Capacity());
}

// Reads one value and checks that writing it again gives the consumed bytes.
template <typename T>
void ReadAndRewrite(MyMemoryBlock& block) {
    const char* start = block.GetGetPointer();
    block.ClearReadError();
    T value{};
    block >> value;
    RequireInside(block);
    if (block.ReadPastEnd()) return;
    long consumed = static_cast<long>(block.GetGetPointer() - start);
    MyMemoryBlock again(0);
    again << value;
    Require(again.Len() == consumed);
    Require(consumed == 0 || std::memcmp(again.GetDatenZeiger(), start, consumed) == 0);
}

template <>
void ReadAndRewrite<FlagSet>(MyMemoryBlock& block) {
    const char* start = block.GetGetPointer();
    block.ClearReadError();
    FlagSet flags(3);
    block >> flags;
    RequireInside(block);
    if (block.ReadPastEnd()) return;
    long consumed = static_cast<long>(block.GetGetPointer() - start);
    Require(consumed == 4 + flags.Count());
    for (int i = 0; i < flags.Count(); ++i) Require(flags.GetFlag(i) == (start[4 + i] != 0));
}

template <>
void ReadAndRewrite<String>(MyMemoryBlock& block) {
    const char* start = block.GetGetPointer();
    block.ClearReadError();
    String text;
    block >> text;
    RequireInside(block);
    long consumed = static_cast<long>(block.GetGetPointer() - start);
    Require(text.Len() <= consumed);
    if (block.ReadPastEnd()) return;
    if (consumed - 1 > static_cast<long>(String::kMaxLen)) return;  // cut to the String limit
    Require(text.Len() + 1 == consumed);
    Require(std::memcmp(text.GetBuffer(), start, consumed) == 0);
}

}  // namespace

extern "C" int LLVMFuzzerTestOneInput(const uint8_t* data, size_t size) {
    if (size == 0) return 0;
    size_t opCount = data[0];
    if (opCount > size - 1) opCount = size - 1;
    const uint8_t* ops = data + 1;
    const uint8_t* payload = ops + opCount;
    const long payloadSize = static_cast<long>(size - 1 - opCount);

    MyMemoryBlock block(payloadSize / 2);  // grows while the payload goes in
    Require(block.Put(payload, payloadSize) == payloadSize);
    RequireInside(block);

    for (size_t i = 0; i < opCount; ++i) {
        const uint8_t op = ops[i];
        switch (op % 14) {
            case 0:
                ReadAndRewrite<char>(block);
                break;
            case 1:
                ReadAndRewrite<unsigned char>(block);
                break;
            case 2:
                ReadAndRewrite<short>(block);
                break;
            case 3:
                ReadAndRewrite<unsigned short>(block);
                break;
            case 4:
                ReadAndRewrite<int>(block);
                break;
            case 5:
                ReadAndRewrite<long>(block);
                break;
            case 6:
                ReadAndRewrite<String>(block);
                break;
            case 7:
                ReadAndRewrite<FlagSet>(block);
                break;
            case 8: {
                unsigned char buffer[16];
                long wanted = op >> 4;
                long left = block.Remaining();
                long got = block.Get(buffer, wanted);
                Require(got == (wanted < left ? wanted : left));
                break;
            }
            case 9:
                block.RememberReadPointer();
                break;
            case 10:
                block.RestoreReadPointer();
                break;
            case 11:
                block.Minimize();
                break;
            case 12: {
                MyMemoryBlock copy(block);
                Require(copy.Len() == block.Len());
                Require(copy.GetGetPointer() == copy.GetDatenZeiger());
                block = copy;
                break;
            }
            case 13:
                block << static_cast<char>(op);
                break;
        }
        RequireInside(block);
    }
    return 0;
}
