// Enciphered spectra with AES-256-GCM; see nxbase/encryptedspectrum.h.
#include "nxbase/encryptedspectrum.h"

#include <openssl/crypto.h>
#include <openssl/evp.h>
#include <openssl/rand.h>

#include <cmath>
#include <cstdint>
#include <cstring>
#include <memory>
#include <mutex>
#include <optional>
#include <stdexcept>
#include <string>

namespace {

constexpr unsigned char kMagic[4] = {'N', 'X', 'S', 'P'};
constexpr unsigned char kVersion = 1;
constexpr std::size_t kHeaderSize = sizeof kMagic + 1;
constexpr std::size_t kNonceSize = 12;
constexpr std::size_t kTagSize = 16;
constexpr std::size_t kCountSize = 4;

struct CipherContextFree {
    void operator()(EVP_CIPHER_CTX* context) const { EVP_CIPHER_CTX_free(context); }
};
using CipherContext = std::unique_ptr<EVP_CIPHER_CTX, CipherContextFree>;

CipherContext NewContext() {
    CipherContext context(EVP_CIPHER_CTX_new());
    if (!context) throw std::runtime_error("EncryptedSpectralData: no cipher context");
    return context;
}

std::mutex& KeyMutex() {
    static std::mutex mutex;
    return mutex;
}

std::optional<EncryptedSpectralData::Key>& ProcessKey() {
    static std::optional<EncryptedSpectralData::Key> key;
    return key;
}

void PutDouble(double value, unsigned char* out) {
    std::uint64_t bits;
    std::memcpy(&bits, &value, sizeof bits);
    for (int i = 0; i < 8; ++i) out[i] = static_cast<unsigned char>(bits >> (8 * i));
}

double GetDouble(const unsigned char* in) {
    std::uint64_t bits = 0;
    for (int i = 0; i < 8; ++i) bits |= static_cast<std::uint64_t>(in[i]) << (8 * i);
    double value;
    std::memcpy(&value, &bits, sizeof value);
    return value;
}

// Overwrites a buffer that held a key or a deciphered spectrum when it goes,
// in a way the compiler may not drop as a dead store.
template <class Buffer>
class Cleansed {
  public:
    explicit Cleansed(Buffer& buffer) : buffer_(buffer) {}
    ~Cleansed() { OPENSSL_cleanse(buffer_.data(), buffer_.size() * sizeof(buffer_[0])); }
    Cleansed(const Cleansed&) = delete;
    Cleansed& operator=(const Cleansed&) = delete;

  private:
    Buffer& buffer_;
};

[[noreturn]] void NotAuthentic() {
    throw std::runtime_error(
        "EncryptedSpectralData: not authentic (wrong key, or altered or foreign data)");
}

}  // namespace

EncryptedSpectralData::EncryptedSpectralData(std::vector<unsigned char> axEncrypted)
    : amEncrypted(std::move(axEncrypted)) {}

EncryptedSpectralData EncryptedSpectralData::Encrypt(const std::vector<double>& axSpectrum,
                                                     const Key& axKey) {
    if (axSpectrum.size() > kMaxValues) {
        throw std::invalid_argument("EncryptedSpectralData: more than " +
                                    std::to_string(kMaxValues) + " values");
    }
    std::vector<unsigned char> plain(kCountSize + 8 * axSpectrum.size());
    const Cleansed<std::vector<unsigned char>> plainGoes(plain);
    const auto count = static_cast<std::uint32_t>(axSpectrum.size());
    for (std::size_t i = 0; i < kCountSize; ++i)
        plain[i] = static_cast<unsigned char>(count >> (8 * i));
    for (std::size_t i = 0; i < axSpectrum.size(); ++i)
        PutDouble(axSpectrum[i], &plain[kCountSize + 8 * i]);

    std::vector<unsigned char> out(kHeaderSize + kNonceSize + plain.size() + kTagSize);
    std::memcpy(out.data(), kMagic, sizeof kMagic);
    out[sizeof kMagic] = kVersion;
    unsigned char* nonce = out.data() + kHeaderSize;
    if (RAND_bytes(nonce, static_cast<int>(kNonceSize)) != 1) {
        throw std::runtime_error("EncryptedSpectralData: no random nonce");
    }
    CipherContext context = NewContext();
    int length = 0;
    unsigned char* cipher = nonce + kNonceSize;
    const bool ok =
        EVP_EncryptInit_ex(context.get(), EVP_aes_256_gcm(), nullptr, nullptr, nullptr) == 1 &&
        EVP_CIPHER_CTX_ctrl(context.get(), EVP_CTRL_GCM_SET_IVLEN, static_cast<int>(kNonceSize),
                            nullptr) == 1 &&
        EVP_EncryptInit_ex(context.get(), nullptr, nullptr, axKey.data(), nonce) == 1 &&
        EVP_EncryptUpdate(context.get(), nullptr, &length, out.data(),
                          static_cast<int>(kHeaderSize)) == 1 &&
        EVP_EncryptUpdate(context.get(), cipher, &length, plain.data(),
                          static_cast<int>(plain.size())) == 1 &&
        EVP_EncryptFinal_ex(context.get(), cipher + length, &length) == 1 &&
        EVP_CIPHER_CTX_ctrl(context.get(), EVP_CTRL_GCM_GET_TAG, static_cast<int>(kTagSize),
                            cipher + plain.size()) == 1;
    if (!ok) throw std::runtime_error("EncryptedSpectralData: encryption failed");
    return EncryptedSpectralData(std::move(out));
}

std::vector<double> EncryptedSpectralData::GetDecryptedSpectrum(const Key& axKey) const {
    const std::vector<unsigned char>& in = amEncrypted;
    if (in.size() < kHeaderSize + kNonceSize + kCountSize + kTagSize ||
        std::memcmp(in.data(), kMagic, sizeof kMagic) != 0 || in[sizeof kMagic] != kVersion) {
        NotAuthentic();
    }
    const unsigned char* nonce = in.data() + kHeaderSize;
    const unsigned char* cipher = nonce + kNonceSize;
    const std::size_t cipherSize = in.size() - kHeaderSize - kNonceSize - kTagSize;
    if (cipherSize > kCountSize + 8 * kMaxValues) NotAuthentic();
    std::vector<unsigned char> plain(cipherSize);
    const Cleansed<std::vector<unsigned char>> plainGoes(plain);
    std::vector<unsigned char> tag(cipher + cipherSize, cipher + cipherSize + kTagSize);
    CipherContext context = NewContext();
    int length = 0;
    const bool ok =
        EVP_DecryptInit_ex(context.get(), EVP_aes_256_gcm(), nullptr, nullptr, nullptr) == 1 &&
        EVP_CIPHER_CTX_ctrl(context.get(), EVP_CTRL_GCM_SET_IVLEN, static_cast<int>(kNonceSize),
                            nullptr) == 1 &&
        EVP_DecryptInit_ex(context.get(), nullptr, nullptr, axKey.data(), nonce) == 1 &&
        EVP_DecryptUpdate(context.get(), nullptr, &length, in.data(),
                          static_cast<int>(kHeaderSize)) == 1 &&
        EVP_DecryptUpdate(context.get(), plain.data(), &length, cipher,
                          static_cast<int>(cipherSize)) == 1 &&
        EVP_CIPHER_CTX_ctrl(context.get(), EVP_CTRL_GCM_SET_TAG, static_cast<int>(kTagSize),
                            tag.data()) == 1 &&
        EVP_DecryptFinal_ex(context.get(), plain.data() + length, &length) == 1;
    if (!ok) NotAuthentic();
    std::uint32_t count = 0;
    for (std::size_t i = 0; i < kCountSize; ++i)
        count |= static_cast<std::uint32_t>(plain[i]) << (8 * i);
    // Authentic bytes that do not hold what the writer writes: not ours.
    if (count > kMaxValues || kCountSize + 8 * static_cast<std::size_t>(count) != plain.size())
        NotAuthentic();
    std::vector<double> spectrum(count);
    for (std::size_t i = 0; i < count; ++i) spectrum[i] = GetDouble(&plain[kCountSize + 8 * i]);
    return spectrum;
}

std::vector<double> EncryptedSpectralData::GetDecryptedSpectrum() const {
    Key key;
    const Cleansed<Key> keyGoes(key);
    {
        std::lock_guard<std::mutex> lock(KeyMutex());
        if (!ProcessKey()) throw std::logic_error("EncryptedSpectralData: no process key set");
        key = *ProcessKey();
    }
    return GetDecryptedSpectrum(key);
}

void EncryptedSpectralData::SetProcessKey(const Key& axKey) {
    std::lock_guard<std::mutex> lock(KeyMutex());
    ProcessKey() = axKey;  // overwrites the old key in place
}

void EncryptedSpectralData::ClearProcessKey() {
    std::lock_guard<std::mutex> lock(KeyMutex());
    if (ProcessKey()) OPENSSL_cleanse(ProcessKey()->data(), ProcessKey()->size());
    ProcessKey().reset();
}
