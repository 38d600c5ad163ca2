// Decodes arbitrary bytes as a received data block is decoded. Decoding never
// grows the data, encoding removes every zero byte, and encoding then
// decoding gives the decoded bytes back.
#include <cstdint>
#include <cstdlib>
#include <cstring>
#include <string>

#include "nxbase/msgcat.h"
#include "nxbase/mymemblo.h"

extern "C" int LLVMFuzzerTestOneInput(const std::uint8_t* data, std::size_t size) {
    const char* bytes = reinterpret_cast<const char*>(data);
    std::string decoded = nxbase::DecodeBytes(bytes, size);
    if (decoded.size() > size) std::abort();
    std::string encoded = nxbase::EncodeBytes(decoded.data(), decoded.size());
    if (encoded.find('\0') != std::string::npos) std::abort();
    if (nxbase::DecodeBytes(encoded.data(), encoded.size()) != decoded) std::abort();
    // The block forms agree with the byte forms.
    MyMemoryBlock block(static_cast<long>(size));
    block.Put(bytes, static_cast<long>(size));
    nxbase::DecodeBlock(block);
    if (std::string(block.GetDatenZeiger(), static_cast<std::size_t>(block.Len())) != decoded) {
        std::abort();
    }
    return 0;
}
