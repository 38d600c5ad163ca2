// Enciphered spectra: exact round trips, and every wrong key or altered byte
// refused rather than turned into a wrong spectrum.
#include "nxbase/encryptedspectrum.h"

#include <fcntl.h>
#include <gtest/gtest.h>
#include <unistd.h>

#include <algorithm>
#include <cmath>
#include <cstring>
#include <fstream>
#include <limits>
#include <random>
#include <stdexcept>
#include <string>
#include <vector>

namespace {

EncryptedSpectralData::Key KeyOf(unsigned char seed) {
    EncryptedSpectralData::Key key;
    for (std::size_t i = 0; i < key.size(); ++i) key[i] = static_cast<unsigned char>(seed + 7 * i);
    return key;
}

std::vector<double> Spectrum() {
    std::vector<double> values;
    for (int i = 0; i < 36; ++i)
        values.push_back(0.05 + 0.9 * std::sin(i * 0.3) * std::sin(i * 0.3));
    // Values whose bits must survive: negative zero, a denormal, extremes.
    values[3] = -0.0;
    values[4] = std::numeric_limits<double>::denorm_min();
    values[5] = std::numeric_limits<double>::max();
    return values;
}

bool SameBits(const std::vector<double>& a, const std::vector<double>& b) {
    return a.size() == b.size() && std::memcmp(a.data(), b.data(), a.size() * sizeof(double)) == 0;
}

TEST(EncryptedSpectralData, RoundTripsBitForBitAndNeverRepeatsItsBytes) {
    const auto key = KeyOf(1);
    const EncryptedSpectralData a = EncryptedSpectralData::Encrypt(Spectrum(), key);
    const EncryptedSpectralData b = EncryptedSpectralData::Encrypt(Spectrum(), key);
    EXPECT_TRUE(SameBits(a.GetDecryptedSpectrum(key), Spectrum()));
    EXPECT_NE(a.GetEncryptedData(), b.GetEncryptedData()) << "a fresh nonce each time";
    EXPECT_EQ(a.GetEncryptedData().size(), 4u + 1u + 12u + 4u + 36u * 8u + 16u);
    // Stored and read back as bytes.
    const EncryptedSpectralData stored(a.GetEncryptedData());
    EXPECT_TRUE(SameBits(stored.GetDecryptedSpectrum(key), Spectrum()));
    // Empty and large spectra too; too large is refused.
    EXPECT_TRUE(EncryptedSpectralData::Encrypt({}, key).GetDecryptedSpectrum(key).empty());
    std::vector<double> big(EncryptedSpectralData::kMaxValues, 0.5);
    EXPECT_EQ(EncryptedSpectralData::Encrypt(big, key).GetDecryptedSpectrum(key).size(),
              big.size());
    big.push_back(0.5);
    EXPECT_THROW(EncryptedSpectralData::Encrypt(big, key), std::invalid_argument);

    // The process key.
    EncryptedSpectralData::ClearProcessKey();
    EXPECT_THROW(a.GetDecryptedSpectrum(), std::logic_error);
    EncryptedSpectralData::SetProcessKey(key);
    EXPECT_TRUE(SameBits(a.GetDecryptedSpectrum(), Spectrum()));
    EncryptedSpectralData::ClearProcessKey();
}

// A key known only as two random halves, so that the test itself never keeps
// a copy of it: the key byte i is mask[i] ^ masked[i].
struct SecretKey {
    EncryptedSpectralData::Key mask, masked;
    SecretKey() {
        std::random_device device;
        for (std::size_t i = 0; i < mask.size(); ++i) {
            mask[i] = static_cast<unsigned char>(device());
            masked[i] = static_cast<unsigned char>(device());
        }
    }
    void Into(EncryptedSpectralData::Key& key) const {
        for (std::size_t i = 0; i < key.size(); ++i) key[i] = mask[i] ^ masked[i];
    }
    bool At(const unsigned char* bytes) const {
        for (std::size_t i = 0; i < mask.size(); ++i) {
            if (bytes[i] != (mask[i] ^ masked[i])) return false;
        }
        return true;
    }
};

void Forget(EncryptedSpectralData::Key& key) {
    volatile unsigned char* bytes = key.data();
    for (std::size_t i = 0; i < key.size(); ++i) bytes[i] = 0;
}

// Where the writable memory of this process holds the key: "[heap]",
// "[stack]", a library's data.
std::vector<std::string> PlacesHolding(const SecretKey& secret) {
    std::vector<std::string> found;
    std::ifstream maps("/proc/self/maps");
    const int mem = ::open("/proc/self/mem", O_RDONLY | O_CLOEXEC);
    std::vector<unsigned char> buffer(1 << 20);
    for (std::string line; std::getline(maps, line);) {
        unsigned long start = 0, end = 0;
        char permissions[5] = {};
        if (std::sscanf(line.c_str(), "%lx-%lx %4s", &start, &end, permissions) != 3) continue;
        if (permissions[0] != 'r' || permissions[1] != 'w' || line.find("[v") != std::string::npos)
            continue;
        // Reservations of sanitizers (terabytes of shadow memory) hold no key.
        if (end - start > (1ul << 30)) continue;
        for (unsigned long at = start; at < end; at += buffer.size() - 32) {
            const std::size_t want = std::min<unsigned long>(buffer.size(), end - at);
            const ssize_t got = ::pread(mem, buffer.data(), want, static_cast<off_t>(at));
            for (ssize_t i = 0; i + 32 <= got; ++i) {
                if (secret.At(buffer.data() + i)) found.push_back(line);
            }
            if (want < buffer.size()) break;
        }
    }
    ::close(mem);
    return found;
}

// Deciphers from deep down the stack, so that what the call leaves in its
// dead frames is not overwritten by the scan.
std::size_t DecipherDeep(const EncryptedSpectralData& data, int depth) {
    volatile unsigned char pad[4096];
    pad[0] = static_cast<unsigned char>(depth);
    if (depth > 0) return DecipherDeep(data, depth - 1) + pad[0] * 0;
    return data.GetDecryptedSpectrum().size();
}

TEST(EncryptedSpectralData, NoCopyOfTheProcessKeyOutlivesItsUse) {
    const SecretKey secret;
    EncryptedSpectralData::Key key;
    secret.Into(key);
    const EncryptedSpectralData data = EncryptedSpectralData::Encrypt(Spectrum(), key);
    EncryptedSpectralData::SetProcessKey(key);
    Forget(key);
    EXPECT_EQ(DecipherDeep(data, 16), Spectrum().size());
    EncryptedSpectralData::ClearProcessKey();
    const std::vector<std::string> places = PlacesHolding(secret);
    EXPECT_TRUE(places.empty()) << "the key is still in " << places.front();
}

TEST(EncryptedSpectralData, RefusesWrongKeysAlteredTruncatedAndForeignBytes) {
    const auto key = KeyOf(1);
    const std::vector<unsigned char> good =
        EncryptedSpectralData::Encrypt(Spectrum(), key).GetEncryptedData();
    EXPECT_THROW(EncryptedSpectralData(good).GetDecryptedSpectrum(KeyOf(2)), std::runtime_error);
    // Every single bit of the bytes is covered: header, nonce, text and tag.
    for (std::size_t byte = 0; byte < good.size(); ++byte) {
        std::vector<unsigned char> bad = good;
        bad[byte] ^= static_cast<unsigned char>(1u << (byte % 8));
        EXPECT_THROW(EncryptedSpectralData(bad).GetDecryptedSpectrum(key), std::runtime_error)
            << "byte " << byte;
    }
    for (std::size_t size : {std::size_t{0}, std::size_t{5}, std::size_t{36}, good.size() - 1}) {
        std::vector<unsigned char> cut(good.begin(), good.begin() + static_cast<long>(size));
        EXPECT_THROW(EncryptedSpectralData(cut).GetDecryptedSpectrum(key), std::runtime_error)
            << size;
    }
    std::vector<unsigned char> longer = good;
    longer.push_back(0);
    EXPECT_THROW(EncryptedSpectralData(longer).GetDecryptedSpectrum(key), std::runtime_error);
    std::mt19937 random(5);
    for (int round = 0; round < 200; ++round) {
        std::vector<unsigned char> junk(random() % 400);
        for (auto& c : junk) c = static_cast<unsigned char>(random());
        if (junk.size() > 5) std::memcpy(junk.data(), "NXSP\1", 5);
        EXPECT_THROW(EncryptedSpectralData(junk).GetDecryptedSpectrum(key), std::runtime_error);
    }
}

}  // namespace
