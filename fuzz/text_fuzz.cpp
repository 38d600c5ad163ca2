// Parses arbitrary bytes as a language file and converts them from UTF-8 to
// the ANSI code page. The parser must accept anything; the table it builds
// must answer lookups consistently; a conversion never grows the text.
#include <cstdint>
#include <cstdlib>
#include <string>
#include <string_view>

#include "nxbase/text.h"

namespace {

void Require(bool axCondition) {
    if (!axCondition) std::abort();
}

}  // namespace

extern "C" int LLVMFuzzerTestOneInput(const uint8_t* data, size_t size) {
    const std::string_view bytes(reinterpret_cast<const char*>(data), size);
    Text::FreeResources();
    nxbase::detail::ParseTextBytes(bytes, "fuzz.lng");

    // Groups the seed corpus uses, and the empty name that is never opened.
    for (const char* group : {"G", "Main", "A", ""}) {
        const unsigned long count = Text::GetEntryCount(group);
        for (unsigned long i = 0; i < count; ++i) {
            Require(Text::GetText(group, i).str().find('\n') == std::string::npos);
        }
        Require(Text::GetText(group, count).IsEmpty());
    }
    Require(Text::GetEntryCount("") == 0);
    Text::FreeResources();

    Require(nxbase::detail::Utf8ToAnsi(bytes).size() <= size);
    return 0;
}
