// Enumerators of the colorimetry classes and the names their tables have in
// the data repositories: one table per enumeration, looked up both ways.
#ifndef NXBASE_SOURCE_COLORIMETRY_NAMED_TYPES_H_
#define NXBASE_SOURCE_COLORIMETRY_NAMED_TYPES_H_

#include <cstddef>
#include <string>

namespace nxbase::detail {

template <typename Type>
struct NamedType {
    Type type;
    const char* name;
};

// The enumerator named `name`, `unknown` when none is.
template <typename Type, std::size_t N>
Type TypeNamed(const NamedType<Type> (&table)[N], const std::string& name, Type unknown) {
    for (const NamedType<Type>& entry : table) {
        if (name == entry.name) return entry.type;
    }
    return unknown;
}

// The name of `type`, "" when it has none.
template <typename Type, std::size_t N>
std::string NameOf(const NamedType<Type> (&table)[N], Type type) {
    for (const NamedType<Type>& entry : table) {
        if (entry.type == type) return entry.name;
    }
    return std::string();
}

}  // namespace nxbase::detail

#endif  // NXBASE_SOURCE_COLORIMETRY_NAMED_TYPES_H_
