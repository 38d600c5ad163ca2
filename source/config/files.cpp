#include "nxbase/files.h"

#include <cstring>
#include <string>

String MakeValidFileName(const String& asName) {
    std::string name = asName.str();
    for (char& c : name) {
        unsigned char u = static_cast<unsigned char>(c);
        if (u < 0x20 || u == 0x7F || std::strchr("\\/:*?\"<>|", c) != nullptr) c = '_';
    }
    // Windows drops trailing blanks and dots from names; keep them visible.
    for (auto it = name.rbegin(); it != name.rend() && (*it == ' ' || *it == '.'); ++it) *it = '_';
    if (name.empty()) name = "_";
    return String(name);
}
