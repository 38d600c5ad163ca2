// REGEDIT4 text reader: arbitrary bytes either parse or raise
// std::runtime_error; never a crash, a hang or another exception.
#include <cstdint>
#include <stdexcept>
#include <string>

#include "nxbase/registry.h"

extern "C" int LLVMFuzzerTestOneInput(const uint8_t* data, size_t size) {
    std::string text(reinterpret_cast<const char*>(data), size);
    try {
        auto changes = nxbase::ParseRegedit4(text, "fuzz.reg");
        for (const auto& change : changes) {
            if (change.kind == nxbase::RegistryStore::Change::Kind::DeleteKey &&
                change.key.find_first_not_of('\\') == std::string::npos) {
                __builtin_trap();  // a whole hive must never be deleted
            }
        }
    } catch (const std::runtime_error&) {
    }
    return 0;
}
