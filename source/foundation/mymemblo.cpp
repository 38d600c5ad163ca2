#include "nxbase/mymemblo.h"

#include <algorithm>
#include <cstdlib>
#include <cstring>
#include <functional>
#include <istream>
#include <limits>
#include <new>
#include <string>
#include <utility>

#include "nxbase/check.h"

namespace {

constexpr std::int32_t kMaxCapacity = std::numeric_limits<std::int32_t>::max();
constexpr int kWordBits = 64;

// The storage is malloc's, so that growing a large block can move its pages
// (realloc) instead of holding the old and the new copy at once. A failure
// is reported through the pointer check instead of std::bad_alloc.
char* AllocateBytes(std::int32_t alCount) {
    char* p = static_cast<char*>(std::malloc(static_cast<std::size_t>(std::max(alCount, 1))));
    if (p == nullptr) Check::POINTER(nullptr, "mymemblo", __DATE__, __TIME__, __LINE__);
    return p;
}

// Resizes the storage, keeping its bytes; on failure `p` is left as it was.
char* ResizeBytes(char* p, std::int32_t alCount) {
    char* resized =
        static_cast<char*>(std::realloc(p, static_cast<std::size_t>(std::max(alCount, 1))));
    if (resized == nullptr) Check::POINTER(nullptr, "mymemblo", __DATE__, __TIME__, __LINE__);
    return resized;
}

std::int32_t ClampCapacity(long alCapacity) {
    if (alCapacity < 0) return 0;
    if (alCapacity > kMaxCapacity) return kMaxCapacity;
    return static_cast<std::int32_t>(alCapacity);
}

template <int N>
std::uint32_t Decode(const unsigned char* p) {
    std::uint32_t value = 0;
    for (int i = 0; i < N; ++i) value |= static_cast<std::uint32_t>(p[i]) << (8 * i);
    return value;
}

int WordCount(int alCount) {
    return static_cast<int>((static_cast<long long>(alCount) + kWordBits - 1) / kWordBits);
}

}  // namespace

// ---------------------------------------------------------------- FlagSet

FlagSet::FlagSet(int alCount) {
    Resize(alCount);
}

FlagSet::FlagSet(int alLow, int alHigh) : amLow(alLow) {
    // In 64 bits: a range as wide as the whole int range must not overflow.
    long long count = static_cast<long long>(alHigh) - alLow;
    Resize(static_cast<int>(std::clamp<long long>(count, 0, std::numeric_limits<int>::max())));
}

int FlagSet::IndexOf(int alFlag) const {
    long long index = static_cast<long long>(alFlag) - amLow;
    return index >= 0 && index < amCount ? static_cast<int>(index) : -1;
}

void FlagSet::Resize(int alCount) {
    amCount = std::max(alCount, 0);
    amWords.resize(static_cast<std::size_t>(WordCount(amCount)), 0);
    ClearUnusedBits();
}

void FlagSet::ClearUnusedBits() {
    int used = amCount % kWordBits;
    if (used != 0 && !amWords.empty()) amWords.back() &= (std::uint64_t{1} << used) - 1;
}

unsigned char FlagSet::GetFlag(int alFlag) const {
    int alIndex = IndexOf(alFlag);
    if (alIndex < 0) return 0;
    return static_cast<unsigned char>((amWords[alIndex / kWordBits] >> (alIndex % kWordBits)) & 1u);
}

void FlagSet::SetFlag(int alFlag) {
    int alIndex = IndexOf(alFlag);
    if (alIndex < 0) return;
    amWords[alIndex / kWordBits] |= std::uint64_t{1} << (alIndex % kWordBits);
}

void FlagSet::ClearFlag(int alFlag) {
    int alIndex = IndexOf(alFlag);
    if (alIndex < 0) return;
    amWords[alIndex / kWordBits] &= ~(std::uint64_t{1} << (alIndex % kWordBits));
}

void FlagSet::SetAll() {
    std::fill(amWords.begin(), amWords.end(), ~std::uint64_t{0});
    ClearUnusedBits();
}

void FlagSet::ClearAll() {
    std::fill(amWords.begin(), amWords.end(), 0);
}

bool FlagSet::IsEmpty() const {
    return std::all_of(amWords.begin(), amWords.end(), [](std::uint64_t w) { return w == 0; });
}

int FlagSet::CountSet() const {
    int count = 0;
    for (std::uint64_t w : amWords) count += __builtin_popcountll(w);
    return count;
}

FlagSet& FlagSet::operator|=(const FlagSet& axOther) {
    if (axOther.amCount > amCount) Resize(axOther.amCount);
    for (std::size_t i = 0; i < axOther.amWords.size(); ++i) amWords[i] |= axOther.amWords[i];
    return *this;
}

FlagSet& FlagSet::operator&=(const FlagSet& axOther) {
    if (axOther.amCount > amCount) Resize(axOther.amCount);
    for (std::size_t i = 0; i < amWords.size(); ++i)
        amWords[i] &= i < axOther.amWords.size() ? axOther.amWords[i] : 0;
    return *this;
}

FlagSet& FlagSet::operator-=(const FlagSet& axOther) {
    if (axOther.amCount > amCount) Resize(axOther.amCount);
    for (std::size_t i = 0; i < axOther.amWords.size(); ++i) amWords[i] &= ~axOther.amWords[i];
    return *this;
}

FlagSet& FlagSet::operator^=(const FlagSet& axOther) {
    if (axOther.amCount > amCount) Resize(axOther.amCount);
    for (std::size_t i = 0; i < axOther.amWords.size(); ++i) amWords[i] ^= axOther.amWords[i];
    return *this;
}

FlagSet FlagSet::operator~() const {
    FlagSet result(*this);
    for (std::uint64_t& w : result.amWords) w = ~w;
    result.ClearUnusedBits();
    return result;
}

FlagSet operator|(FlagSet a, const FlagSet& b) {
    return a |= b;
}
FlagSet operator&(FlagSet a, const FlagSet& b) {
    return a &= b;
}
FlagSet operator-(FlagSet a, const FlagSet& b) {
    return a -= b;
}
FlagSet operator^(FlagSet a, const FlagSet& b) {
    return a ^= b;
}

// ---------------------------------------------------------- MyMemoryBlock

MyMemoryBlock::MyMemoryBlock() : MyMemoryBlock(kDefaultCapacity) {}

MyMemoryBlock::MyMemoryBlock(long alCapacity) {
    const std::int32_t size = ClampCapacity(alCapacity);
    SetStorage(AllocateBytes(size), size);
    getPointer = putPointer = rememberedRead = rememberedWrite = data;
}

MyMemoryBlock::MyMemoryBlock(const MyMemoryBlock& axOther) : MyMemoryBlock(axOther.Capacity()) {
    Put(axOther.data, axOther.Len());
}

MyMemoryBlock& MyMemoryBlock::operator=(const MyMemoryBlock& axOther) {
    if (this == &axOther) return *this;
    // Allocate before freeing, so that a failed allocation leaves this block intact.
    const auto size = static_cast<std::int32_t>(axOther.Capacity());
    char* fresh = AllocateBytes(size);
    std::free(data);
    SetStorage(fresh, size);
    readPastEnd = false;
    getPointer = putPointer = rememberedRead = rememberedWrite = data;
    Put(axOther.data, axOther.Len());
    return *this;
}

MyMemoryBlock::MyMemoryBlock(MyMemoryBlock&& axOther) noexcept {
    *this = std::move(axOther);
}

MyMemoryBlock& MyMemoryBlock::operator=(MyMemoryBlock&& axOther) noexcept {
    if (this == &axOther) return *this;
    std::free(data);
    data = std::exchange(axOther.data, nullptr);
    getPointer = std::exchange(axOther.getPointer, nullptr);
    putPointer = std::exchange(axOther.putPointer, nullptr);
    rememberedRead = std::exchange(axOther.rememberedRead, nullptr);
    rememberedWrite = std::exchange(axOther.rememberedWrite, nullptr);
    end = std::exchange(axOther.end, nullptr);
    wordLimit = std::exchange(axOther.wordLimit, nullptr);
    readPastEnd = std::exchange(axOther.readPastEnd, false);
    return *this;
}

MyMemoryBlock::~MyMemoryBlock() {
    std::free(data);
}

void MyMemoryBlock::Reallocate(std::int32_t alCapacity) {
    // Positions as offsets: the old pointers are not to be used once moved.
    const auto get = getPointer - data, put = putPointer - data;
    const auto readMark = rememberedRead - data, writeMark = rememberedWrite - data;
    SetStorage(ResizeBytes(data, alCapacity), alCapacity);
    getPointer = data + get;
    putPointer = data + put;
    rememberedRead = data + readMark;
    rememberedWrite = data + writeMark;
}

void MyMemoryBlock::SetStorage(char* fresh, std::int32_t alCapacity) {
    data = fresh;
    end = fresh + alCapacity;
    wordLimit = alCapacity >= 16 ? end - 15 : fresh;
}

void MyMemoryBlock::CheckSize(long alCount) {
    long needed = Len() + alCount;
    if (Capacity() >= needed) return;
    if (needed > kMaxCapacity) needed = kMaxCapacity;
    long grown = std::max<long>(Capacity(), 1);
    while (grown < needed) grown *= 2;
    Reallocate(ClampCapacity(grown));
}

long MyMemoryBlock::Put(const void* p, long alCount) {
    if (alCount <= 0) return 0;
    const char* source = static_cast<const char*>(p);
    if (!std::less<const char*>()(source, data) && std::less<const char*>()(source, end)) {
        // Copying from inside this block: keep the source valid across growth.
        long offset = static_cast<long>(source - data);
        CheckSize(alCount);
        source = data + offset;
    } else {
        CheckSize(alCount);
    }
    long copied = std::min<long>(alCount, static_cast<long>(end - putPointer));
    if (copied <= 0) return 0;
    std::memmove(putPointer, source, static_cast<std::size_t>(copied));
    putPointer += copied;
    return copied;
}

char* MyMemoryBlock::PutAndTell(const void* p, long alCount) {
    Put(p, alCount);
    return putPointer;
}

long MyMemoryBlock::Get(void* p, long alCount) {
    if (alCount <= 0) return 0;
    long copied = std::min<long>(alCount, Remaining());
    if (copied < alCount) readPastEnd = true;
    if (copied > 0) {
        std::memcpy(p, getPointer, static_cast<std::size_t>(copied));
        getPointer += copied;
    }
    return copied;
}

void MyMemoryBlock::Minimize() {
    if (Capacity() != Len()) Reallocate(static_cast<std::int32_t>(Len()));
}

void MyMemoryBlock::RestoreWritePointer() {
    putPointer = rememberedWrite;
    if (getPointer > putPointer) getPointer = putPointer;
    if (rememberedRead > putPointer) rememberedRead = putPointer;
}

template <int N>
void MyMemoryBlock::GetBytes(unsigned char* p) {
    if (Remaining() >= N) {
        std::memcpy(p, getPointer, N);
        getPointer += N;
        return;
    }
    Get(p, N);
}

// ------------------------------------------------------------- writers

MyMemoryBlock& MyMemoryBlock::operator>>(signed char& axValue) {
    char value = static_cast<char>(axValue);
    *this >> value;
    axValue = static_cast<signed char>(value);
    return *this;
}

MyMemoryBlock& MyMemoryBlock::operator<<(const char* asValue) {
    if (asValue != nullptr) Put(asValue, static_cast<long>(std::strlen(asValue)));
    return *this;
}

MyMemoryBlock& MyMemoryBlock::operator<<(const FlagSet& axValue) {
    int count = axValue.Count();
    *this << count;
    CheckSize(count);
    for (int i = 0; i < count; ++i) {
        *this << static_cast<unsigned char>(axValue.GetFlag(axValue.Low() + i));
    }
    return *this;
}

MyMemoryBlock& MyMemoryBlock::operator<<(std::iostream& axStream) {
    std::streambuf* buffer = axStream.rdbuf();
    std::string bytes;
    if (buffer != nullptr) {
        std::streampos current = buffer->pubseekoff(0, std::ios_base::cur, std::ios_base::in);
        std::streampos end = buffer->pubseekoff(0, std::ios_base::end, std::ios_base::in);
        if (current != std::streampos(-1) && end != std::streampos(-1) &&
            buffer->pubseekpos(0, std::ios_base::in) != std::streampos(-1)) {
            bytes.resize(static_cast<std::size_t>(std::min<std::streamoff>(end, kMaxCapacity)));
            bytes.resize(static_cast<std::size_t>(
                buffer->sgetn(bytes.data(), static_cast<std::streamsize>(bytes.size()))));
            buffer->pubseekpos(current, std::ios_base::in);
        } else {
            // Not seekable: take what is left to read.
            char chunk[4096];
            for (std::streamsize got; (got = buffer->sgetn(chunk, sizeof chunk)) > 0;)
                bytes.append(chunk, static_cast<std::size_t>(got));
        }
    }
    *this << static_cast<int>(bytes.size());
    Put(bytes.data(), static_cast<long>(bytes.size()));
    return *this;
}

// ------------------------------------------------------------- readers
// A short read leaves the bytes it could not fill as they were, so each
// scalar reader starts from the target's own little-endian image.

MyMemoryBlock& MyMemoryBlock::operator>>(char& axValue) {
    unsigned char byte = static_cast<unsigned char>(axValue);
    GetBytes<1>(&byte);
    axValue = static_cast<char>(byte);
    return *this;
}

MyMemoryBlock& MyMemoryBlock::operator>>(unsigned char& axValue) {
    GetBytes<1>(&axValue);
    return *this;
}

MyMemoryBlock& MyMemoryBlock::operator>>(short& axValue) {
    unsigned short value = static_cast<unsigned short>(axValue);
    *this >> value;
    axValue = static_cast<short>(value);
    return *this;
}

MyMemoryBlock& MyMemoryBlock::operator>>(unsigned short& axValue) {
    unsigned char bytes[2];
    LittleEndian<2>(axValue, bytes);
    GetBytes<2>(bytes);
    axValue = static_cast<unsigned short>(Decode<2>(bytes));
    return *this;
}

MyMemoryBlock& MyMemoryBlock::operator>>(long& axValue) {
    unsigned char bytes[4];
    LittleEndian<4>(static_cast<std::uint32_t>(axValue), bytes);
    GetBytes<4>(bytes);
    axValue = static_cast<long>(static_cast<std::int32_t>(Decode<4>(bytes)));
    return *this;
}

MyMemoryBlock& MyMemoryBlock::operator>>(int& axValue) {
    long value = axValue;
    *this >> value;
    axValue = static_cast<int>(value);
    return *this;
}

MyMemoryBlock& MyMemoryBlock::operator>>(String& asValue) {
    std::size_t available = static_cast<std::size_t>(Remaining());
    const char* zero = static_cast<const char*>(std::memchr(getPointer, 0, available));
    std::size_t textLength =
        zero != nullptr ? static_cast<std::size_t>(zero - getPointer) : available;
    asValue = String(std::string_view(getPointer, textLength));
    if (zero != nullptr) {
        getPointer += textLength + 1;
    } else {
        getPointer = putPointer;
        readPastEnd = true;
    }
    return *this;
}

MyMemoryBlock& MyMemoryBlock::operator>>(FlagSet& axValue) {
    long count = 0;
    long before = Remaining();
    *this >> count;
    if (before < 4 || count < 0 || count > Remaining()) {
        getPointer = putPointer;
        readPastEnd = true;
        return *this;
    }
    FlagSet flags(static_cast<int>(count));
    for (int i = 0; i < count; ++i) {
        if (getPointer[i] != 0) flags.SetFlag(i);
    }
    getPointer += count;
    axValue = std::move(flags);
    return *this;
}
