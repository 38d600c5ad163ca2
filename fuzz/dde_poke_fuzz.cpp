// The path of a D-Bus poke: arbitrary bytes as the poke's data (sender, ":",
// encoded block) and item, taken apart as the DDE transport does and handed
// to the post office. The sender must be the text before the first colon,
// the block must decode without reading outside the data, and the post
// office must take any item and block. The first byte is the item's length.
#include <cstdint>
#include <cstdlib>
#include <string>

#include "nxbase/dde.h"
#include "nxbase/msgcat.h"
#include "nxbase/postoffice.h"
#include "messaging_fuzz_env.h"

namespace {

void Require(bool condition) {
    if (!condition) std::abort();
}

PostOffice* Office() {
    static PostOffice* office = [] {
        nxfuzz::PrepareMessagingEnvironment("nxbase-ddefuzz");
        return PostOffice::CreatePostOffice("LumaServer");
    }();
    return office;
}

}  // namespace

extern "C" int LLVMFuzzerTestOneInput(const std::uint8_t* data, std::size_t size) {
    if (size < 1) return 0;
    std::size_t itemLength = std::min<std::size_t>(data[0], size - 1);
    std::string item(reinterpret_cast<const char*>(data) + 1, itemLength);
    std::string poke(reinterpret_cast<const char*>(data) + 1 + itemLength, size - 1 - itemLength);
    std::string sender;
    MyMemoryBlock block;
    nxbase::SplitPoke(poke, sender, block);
    std::size_t colon = poke.find(':');
    Require(sender == (colon == std::string::npos ? std::string() : poke.substr(0, colon)));
    std::string encoded = colon == std::string::npos ? poke : poke.substr(colon + 1);
    Require(std::string(block.GetDatenZeiger(), static_cast<std::size_t>(block.Len())) ==
            nxbase::DecodeBytes(encoded.data(), encoded.size()));
    VELTRAEvent event(sender, item, std::move(block));
    Office()->CommunicationReceiveFunction(event);
    return 0;
}
