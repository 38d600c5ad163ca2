// MyMemoryBlock is a growable byte buffer with one write and one read
// position whose stream operators define the byte format of message payloads;
// FlagSet is a numbered set of flags that travels in such blocks. Both are
// values: one object must not be used by two threads at once.
//
// Byte format (little-endian on every host, no padding, no type tags):
//   char, unsigned char    1 byte
//   short, unsigned short  2 bytes
//   int, long              4 bytes (a long is written as its low 32 bits)
//   String                 the characters, then one zero byte
//   const char*            the characters only, without a zero byte
//   FlagSet                the count as 4-byte int, then one byte per flag
//                          (1 set, 0 clear)
//   std::iostream          the byte count as 4-byte int, then the bytes
//
// Storage: one malloc'd array, grown with realloc (a large block's pages move
// instead of being copied), so that pointers into it (GetDatenZeiger and the
// like) are stale after any write that grows it.
//
// Error model: allocation failure is reported by Check::POINTER (which throws
// the int 1); a growth that fails leaves the block as it was. Readers never read outside the
// written data and never throw: a read that finds fewer bytes than it needs stops at the end of the
// data, leaves what it could not fill unchanged and sets ReadPastEnd().
#ifndef NXBASE_MYMEMBLO_H_
#define NXBASE_MYMEMBLO_H_

#include <cstdint>
#include <cstring>
#include <iosfwd>
#include <string_view>
#include <vector>

#include "nxbase/export.h"
#include "toolkit/string.h"

// The inline writers store whole little-endian words (GCC and Clang), and
// short texts as 16 bytes where a String's storage is known to hold them
// (libstdc++'s std::string of the C++11 ABI).
#if defined(__GNUC__) && defined(__BYTE_ORDER__) && __BYTE_ORDER__ == __ORDER_LITTLE_ENDIAN__
#define NXBASE_WORD_STORES 1
#if defined(_GLIBCXX_USE_CXX11_ABI) && _GLIBCXX_USE_CXX11_ABI
#define NXBASE_TEXT_WORDS 1
#endif
#endif

// A set of flags numbered Low() to High()-1, all clear unless set. The
// serialised form holds only the count and the flags in order, so a set read
// from a block is numbered from 0.
class NXBASE_EXPORT FlagSet {
  public:
    // `alCount` flags numbered from 0 (a negative count gives an empty set).
    explicit FlagSet(int alCount = 0);
    // The flags numbered `alLow` to `alHigh` - 1: FlagSet(-2, 135) holds 137
    // flags, -2 to 134; an empty range gives an empty set.
    FlagSet(int alLow, int alHigh);

    int Count() const { return amCount; }
    int Low() const { return amLow; }
    int High() const { return amLow + amCount; }
    // 1 when flag number `alFlag` is set, 0 when it is clear or out of range.
    unsigned char GetFlag(int alFlag) const;
    // Sets or clears one flag; a number out of range changes nothing.
    void SetFlag(int alFlag);
    void ClearFlag(int alFlag);
    void SetAll();
    void ClearAll();
    bool IsEmpty() const;  // no flag set
    int CountSet() const;

    // Set operators, flag by flag in index order (the left operand keeps its
    // numbering). Operands of different counts act as if the shorter one were
    // extended with clear flags; the result has the larger count.
    FlagSet& operator|=(const FlagSet& axOther);
    FlagSet& operator&=(const FlagSet& axOther);
    FlagSet& operator-=(const FlagSet& axOther);  // difference: clears the other's flags
    FlagSet& operator^=(const FlagSet& axOther);
    // Complement within the same count.
    FlagSet operator~() const;

    // Equal when the numbering, the counts and every flag agree.
    friend bool operator==(const FlagSet& a, const FlagSet& b) {
        return a.amLow == b.amLow && a.amCount == b.amCount && a.amWords == b.amWords;
    }
    friend bool operator!=(const FlagSet& a, const FlagSet& b) { return !(a == b); }

  private:
    void Resize(int alCount);
    void ClearUnusedBits();
    // Index of flag number `alFlag`, or -1 when it is out of range.
    int IndexOf(int alFlag) const;

    int amLow = 0;
    int amCount = 0;
    std::vector<std::uint64_t> amWords;
};

NXBASE_EXPORT FlagSet operator|(FlagSet a, const FlagSet& b);
NXBASE_EXPORT FlagSet operator&(FlagSet a, const FlagSet& b);
NXBASE_EXPORT FlagSet operator-(FlagSet a, const FlagSet& b);
NXBASE_EXPORT FlagSet operator^(FlagSet a, const FlagSet& b);

class NXBASE_EXPORT MyMemoryBlock {
  public:
    static constexpr long kDefaultCapacity = 1024;

    // An empty block of 1024 bytes, or of `alCapacity` bytes (negative counts
    // as 0). All positions at the start.
    MyMemoryBlock();
    explicit MyMemoryBlock(long alCapacity);
    // The copy has the source's capacity and its written bytes; its read and
    // remembered positions are at the start, whatever the source's were.
    MyMemoryBlock(const MyMemoryBlock& axOther);
    MyMemoryBlock& operator=(const MyMemoryBlock& axOther);
    // Takes the other's storage and positions; the other is left empty.
    MyMemoryBlock(MyMemoryBlock&& axOther) noexcept;
    MyMemoryBlock& operator=(MyMemoryBlock&& axOther) noexcept;
    ~MyMemoryBlock();

    // Appends `alCount` bytes from `p` at the write position, growing the
    // block by doubling; returns the number of bytes written (fewer only when
    // the block would pass 2^31-1 bytes). A count <= 0 writes nothing.
    long Put(const void* p, long alCount);
    // Copies up to `alCount` bytes from the read position into `p` and
    // advances it; returns the number copied. Stops at the end of the written
    // data and leaves the rest of `p` unchanged (sets ReadPastEnd()).
    long Get(void* p, long alCount);

    long Len() const { return static_cast<long>(putPointer - data); }
    // The written bytes, valid until the block changes.
    std::string_view Bytes() const {
        return std::string_view(data, static_cast<std::size_t>(Len()));
    }
    long Capacity() const { return static_cast<long>(end - data); }
    // Bytes between the read and the write position.
    long Remaining() const { return static_cast<long>(putPointer - getPointer); }
    char* GetDatenZeiger() { return data; }
    const char* GetDatenZeiger() const { return data; }
    char* GetGetPointer() { return getPointer; }
    char* GetPutPointer() { return putPointer; }

    // Shrinks the storage to exactly Len() bytes, keeping content and positions.
    void Minimize();

    // Saves the read or write position; Restore puts it back. Restoring the
    // write position also cuts the written data there (and pulls the read
    // position back if it lay beyond), so that writing resumes at that point.
    void RememberReadPointer() { rememberedRead = getPointer; }
    void RestoreReadPointer() { getPointer = rememberedRead; }
    void RememberWritePointer() { rememberedWrite = putPointer; }
    void RestoreWritePointer();

    // True once any read found fewer bytes than it needed; cleared by
    // ClearReadError().
    bool ReadPastEnd() const { return readPastEnd; }
    void ClearReadError() { readPastEnd = false; }

    // The writers of numbers and texts are inline: while the room is there,
    // a value costs a store, as writing its bytes by hand would.
    MyMemoryBlock& operator<<(char axValue) { return PutLittleEndian<1>(std::uint8_t(axValue)); }
    MyMemoryBlock& operator<<(unsigned char axValue) { return PutLittleEndian<1>(axValue); }
    // One byte, as char.
    MyMemoryBlock& operator<<(signed char axValue) {
        return PutLittleEndian<1>(std::uint8_t(axValue));
    }
    MyMemoryBlock& operator<<(short axValue) { return PutLittleEndian<2>(std::uint16_t(axValue)); }
    MyMemoryBlock& operator<<(unsigned short axValue) { return PutLittleEndian<2>(axValue); }
    MyMemoryBlock& operator<<(int axValue) { return PutLittleEndian<4>(std::uint32_t(axValue)); }
    // The low 32 bits, as a 32-bit long would carry them.
    MyMemoryBlock& operator<<(long axValue) { return PutLittleEndian<4>(std::uint32_t(axValue)); }
    // The characters and the terminating zero.
    MyMemoryBlock& operator<<(const String& asValue) {
        const long count = static_cast<long>(asValue.Len()) + 1;
#ifdef NXBASE_TEXT_WORDS
        if (__builtin_expect(count <= 16 && putPointer < wordLimit, 1)) {
            PutSixteen(asValue.GetBuffer());
            putPointer += count;
            return *this;
        }
#endif
        putPointer = PutAndTell(asValue.GetBuffer(), count);
        return *this;
    }
    // The characters without a terminating zero: read them back with Get and
    // a known length, not with the String reader.
    MyMemoryBlock& operator<<(const char* asValue);
    MyMemoryBlock& operator<<(const FlagSet& axValue);
    // The stream's whole content (from its start, whatever its positions);
    // the stream's read position is left where it was.
    MyMemoryBlock& operator<<(std::iostream& axStream);

    MyMemoryBlock& operator>>(char& axValue);
    MyMemoryBlock& operator>>(unsigned char& axValue);
    MyMemoryBlock& operator>>(signed char& axValue);
    MyMemoryBlock& operator>>(short& axValue);
    MyMemoryBlock& operator>>(unsigned short& axValue);
    MyMemoryBlock& operator>>(int& axValue);
    MyMemoryBlock& operator>>(long& axValue);  // sign-extended from 4 bytes
    // The characters up to the next zero byte; the read position moves past
    // it. Without a zero byte before the end of the data the rest of the data
    // is taken and ReadPastEnd() is set. A text longer than String::kMaxLen
    // is cut, but the whole of it is consumed.
    MyMemoryBlock& operator>>(String& asValue);
    // Replaces the target with an all-clear set of the count read, then sets
    // the flags whose byte is not zero. A count that is negative or larger
    // than the bytes left cannot come from a well-formed block: the target is
    // left unchanged, the rest of the data is consumed and ReadPastEnd() set.
    MyMemoryBlock& operator>>(FlagSet& axValue);

  private:
    // Makes room for `alCount` more bytes, doubling the capacity.
    void CheckSize(long alCount);
    // Takes `fresh` of `alCapacity` bytes as the storage (end and wordLimit).
    void SetStorage(char* fresh, std::int32_t alCapacity);
    // Resizes the storage to `alCapacity` bytes (>= Len()), in place or
    // moved, keeping the content; the positions follow it.
    void Reallocate(std::int32_t alCapacity);
    // The little-endian image of the low N bytes of a value.
    template <int N>
    static void LittleEndian(std::uint32_t axValue, unsigned char* p) {
        for (int i = 0; i < N; ++i) p[i] = static_cast<unsigned char>(axValue >> (8 * i));
    }
    template <int N>
    MyMemoryBlock& PutLittleEndian(std::uint32_t axValue) {
#ifdef NXBASE_WORD_STORES
        // The whole word is stored and the position moves by N: the bytes
        // past it are the value's own and the next write covers them.
        if (__builtin_expect(putPointer < wordLimit, 1)) {
            StoreWord(putPointer, axValue);
            putPointer += N;
            return *this;
        }
#endif
        unsigned char bytes[N];
        LittleEndian<N>(axValue, bytes);
        putPointer = PutAndTell(bytes, N);
        return *this;
    }
    // Put() answering the new write position: the inline writers take it
    // from the register, where reading the member again after the call
    // would make every later write wait for that load.
    char* PutAndTell(const void* p, long alCount);
#ifdef NXBASE_WORD_STORES
    // Words stored at any address. A store of a char could change any
    // object, the block's own positions included, so that after it every
    // position would be read again from memory; a store of one of these
    // cannot, and a run of writes keeps its position in a register.
    // (Not through a template: a typedef's alignment is lost in its argument.)
    typedef std::uint32_t Word32 __attribute__((aligned(1)));
    typedef std::uint64_t Word64 __attribute__((aligned(1)));
    static void StoreWord(char* to, std::uint32_t axValue) {
        *reinterpret_cast<Word32*>(to) = axValue;
    }
    static void StoreWord(char* to, std::uint64_t axValue) {
        *reinterpret_cast<Word64*>(to) = axValue;
    }
#endif
#ifdef NXBASE_TEXT_WORDS
    // 16 bytes from a String's storage, with room for 16: a text of up to 15
    // characters and its zero in one copy, without a branch on its length.
    // The storage of a std::string holds at least 16 bytes (its own buffer
    // of 15 characters and the zero, or a heap buffer that held more); the
    // bytes past the zero are copied as they are and the next write covers
    // them, as it covers the rest of a word.
    void PutSixteen(const char* from) {
        std::uint64_t head, tail;
        std::memcpy(&head, from, 8);
        std::memcpy(&tail, from + 8, 8);
        StoreWord(putPointer, head);
        StoreWord(putPointer + 8, tail);
    }
#endif
    // The fixed-size helper of the number readers (defined in the .cpp only).
    template <int N>
    void GetBytes(unsigned char* p);

    char* data = nullptr;
    char* getPointer = nullptr;
    char* putPointer = nullptr;
    char* rememberedRead = nullptr;
    char* rememberedWrite = nullptr;
    char* end = nullptr;  // of the storage: Capacity() bytes after data
    // While putPointer < wordLimit, 16 bytes are free: the inline writers'
    // test of room is one comparison of two registers.
    char* wordLimit = nullptr;
    bool readPastEnd = false;
};

#endif  // NXBASE_MYMEMBLO_H_
