// EncryptedSpectralData: a spectrum kept enciphered, for spectral data that a
// supplier hands out for computation but not for reading (reference sets,
// licensed libraries of colorants).
//
// Cipher: AES-256-GCM from OpenSSL's libcrypto, an authenticated cipher:
// a wrong key, or any change of the bytes, is detected on decryption and
// refused, never turned into a wrong spectrum. Layout of the enciphered
// bytes (all of it authenticated):
//   "NXSP" | version 1 (one byte) | 12-byte random nonce |
//   ciphertext of (count as 32-bit little-endian, count IEEE 754 doubles
//   little-endian) | 16-byte authentication tag.
// Keys are 32 bytes chosen by the application (a random key stored with its
// licence, for instance); the library never derives or stores one itself.
// The copies of a key and the deciphered bytes that the library makes while
// it works are wiped (OPENSSL_cleanse) before their memory is given back;
// the caller's own copies remain the caller's to wipe.
#ifndef NXBASE_ENCRYPTEDSPECTRUM_H_
#define NXBASE_ENCRYPTEDSPECTRUM_H_

#include <array>
#include <cstddef>
#include <vector>

#include "nxbase/export.h"

class NXBASE_EXPORT EncryptedSpectralData {
  public:
    static constexpr std::size_t kKeySize = 32;
    // Most values one spectrum may hold.
    static constexpr std::size_t kMaxValues = 4096;
    using Key = std::array<unsigned char, kKeySize>;

    EncryptedSpectralData() = default;
    // Enciphered bytes as stored or received; checked only on decryption.
    explicit EncryptedSpectralData(std::vector<unsigned char> axEncrypted);

    // Enciphers `axSpectrum` (at most kMaxValues values) under `axKey` with a
    // fresh random nonce: the same spectrum gives different bytes each time.
    // Throws std::invalid_argument for too many values, std::runtime_error
    // when the cipher fails.
    static EncryptedSpectralData Encrypt(const std::vector<double>& axSpectrum, const Key& axKey);

    const std::vector<unsigned char>& GetEncryptedData() const { return amEncrypted; }

    // The spectrum, deciphered with `axKey`; std::runtime_error ("not
    // authentic") for a wrong key or altered, truncated or foreign bytes.
    std::vector<double> GetDecryptedSpectrum(const Key& axKey) const;
    // The same with the process key; std::logic_error when none is set.
    std::vector<double> GetDecryptedSpectrum() const;

    // The key GetDecryptedSpectrum() uses, for the whole process; a new key
    // overwrites the old one in place.
    static void SetProcessKey(const Key& axKey);
    // Wipes the process key; GetDecryptedSpectrum() then throws.
    static void ClearProcessKey();

  private:
    std::vector<unsigned char> amEncrypted;
};

#endif  // NXBASE_ENCRYPTEDSPECTRUM_H_
