#include "nxbase/msgcat.h"

#include <cstring>
#include <iterator>
#include <unordered_map>

#include "nxbase/mymemblo.h"

// Every message once, in the order of its number: the names below and the
// check that each stands at its enum value come from this one list.
#define NXBASE_MESSAGES(X)       \
    X(CONNECT)                   \
    X(DISCONNECT)                \
    X(LOCK)                      \
    X(UNLOCK)                    \
    X(CANCEL_REQUEST)            \
    X(IS_APP_READY)              \
    X(GET_APP_VERSION)           \
    X(GET_TOP_WINDOW_POS)        \
    X(GET_SW_VERSION)            \
    X(GET_SERIE_NR)              \
    X(GET_DISPLAY_STRING)        \
    X(IS_A_LPM)                  \
    X(IS_A_DENSITOMETER)         \
    X(GET_DEVICE_TYPE)           \
    X(GET_DEVICE_NAME)           \
    X(SPECTRUM_REQUEST)          \
    X(INDEX_VALUE_REQUEST)       \
    X(TIME_REQUEST)              \
    X(TIME_DOWNLOAD)             \
    X(STD_NAME_DOWNLOAD)         \
    X(GET_VAL_NR_VALUE)          \
    X(STD_NAME_REQUEST)          \
    X(NAME_18_REQUEST)           \
    X(DEL_VAL_NR)                \
    X(GET_VAL_NR_LIB)            \
    X(SET_VAL_NR_LIB)            \
    X(PARAMETER_REQUEST)         \
    X(PARAMETER_DOWNLOAD)        \
    X(EXEC_MEASUREMENT)          \
    X(EXEC_WHITE_MEASUREMENT)    \
    X(EXEC_REF_MEASUREMENT)      \
    X(WHITE_REF_REQUEST)         \
    X(ALT_TAB_ACTIV_REQUEST)     \
    X(GET_VAL_NR_TAB)            \
    X(SET_VAL_NR_TAB)            \
    X(NEW_MEASURE_REQUEST)       \
    X(MEAS_CONTROL_DOWNLOAD)     \
    X(MEAS_CONTROL_REQUEST)      \
    X(NEW_USER_GUIDE_REQUEST)    \
    X(USER_GUIDE_DOWNLOAD)       \
    X(SET_VAL_NR_VALUE)          \
    X(C_DOWNLOAD)                \
    X(SPECTRUM_DOWNLOAD)         \
    X(MESSUNG_AUSGELOEST)        \
    X(STATUSAENDERUNG)           \
    X(NOTIFY_MESSUNG)            \
    X(NOTIFY_MESSUNG_AUS)        \
    X(NOTIFY_STATUS)             \
    X(IS_READY)                  \
    X(OPTIONEN_EINSTELLEN)       \
    X(SCAN_LPM)                  \
    X(MOVE_ABSOLUT)              \
    X(MOVE_RELATIVE)             \
    X(MOVE_HOME)                 \
    X(MOVE_UP)                   \
    X(MOVE_DOWN)                 \
    X(MOVE_WHITE_REF_POS)        \
    X(OUTPUT_ACTUAL_POSITION)    \
    X(INITIALIZE_DEVICE)         \
    X(SCAN_LUMIPROBE)            \
    X(SET_DEVICE_ONLINE)         \
    X(SET_DEVICE_OFFLINE)        \
    X(HOLD_PAPER)                \
    X(RELEASE_PAPER)             \
    X(SET_DIGITIZING_MODE)       \
    X(OUTPUT_DIGITIZING_VALUES)  \
    X(CHANGE_BAUDRATE)           \
    X(CHANGE_HANDSHAKE)          \
    X(OUTPUT_ACTUAL_KEY)         \
    X(OUTPUT_LAST_KEY)           \
    X(OUTPUT_STATUS)             \
    X(CLEAR_STATUS)              \
    X(SET_SPECIAL_STATUS)        \
    X(CLEAR_SPECIAL_STATUS)      \
    X(OUTPUT_SPECIAL_STATUS)     \
    X(ACTUAL_ERROR_REQUEST)      \
    X(OUTPUT_TYPE)               \
    X(OUTPUT_SERIAL_NUMBER)      \
    X(OUTPUT_ARTICLE_NUMBER)     \
    X(OUTPUT_PRODUCTION_DATE)    \
    X(OUTPUT_SOFTWARE_VERSION)   \
    X(ENTER_KEY_PRESSED)         \
    X(NOTIFY_ENTER_KEY)          \
    X(NOTIFY_ENTER_KEY_AUS)      \
    X(GET_SPECTRUM_AT_POS)       \
    X(SET_TABLE_MODE)            \
    X(SET_LIGHT_LEVEL)           \
    X(SET_TRANSM_STANDBY_POS)    \
    X(GET_ACCESS_CODE)           \
    X(RETURN_ACCESS_CODE)        \
    X(PROGRAM_KEY)               \
    X(DOWNLOAD_PROGRAM)          \
    X(DOWNLOAD_ORIGIN_OFFSET)    \
    X(DOWNLOAD_TRANS_LAMP_MODE)  \
    X(HASA_LUMITABLE)            \
    X(HASA_LUMITABLE_T)          \
    X(ISA_LUMIPROBE)             \
    X(ISA_LPM)                   \
    X(ISA_DENSITOMETER)          \
    X(ISA_VIDIPROBE)             \
    X(ISA_LUMI_VIEW)             \
    X(FILTER_DOWNLOAD)           \
    X(GET_CHILDREN)              \
    X(HAS_CHILDREN)              \
    X(GET_OBJECT)                \
    X(GRADUS_CONNECT)            \
    X(NEW_FORMULA)               \
    X(MODIFY_OPTIONS)            \
    X(FILE_ACT_DRIVE_REQUEST)    \
    X(FILE_CHANGE_DRIVE)         \
    X(FILE_FORMAT_DRIVE)         \
    X(FILE_DISC_SPACE_REQUEST)   \
    X(FILE_ACT_DIR_REQUEST)      \
    X(FILE_CHANGE_DIR)           \
    X(FILE_CREATE_DIR)           \
    X(FILE_DELETE_DIR)           \
    X(FILE_RENAME_DIR)           \
    X(FILE_DELETE_FILE)          \
    X(FILE_RENAME_FILE)          \
    X(FILE_STATUS_REQUEST)       \
    X(FILE_ENTRY_COUNT)          \
    X(FILE_ENTRY_REQUEST)        \
    X(FILE_CREATE_FILE)          \
    X(FILE_ACCESS_START)         \
    X(FILE_ACCESS_END)           \
    X(FILE_WRITE_TO_FILE)        \
    X(FILE_READ_FROM_FILE)       \
    X(GET_DEVICE_CATEGORY)       \
    X(NETGAUGE_GET_STATUS)       \
    X(BRING_APP_WINDOW_TO_FRONT) \
    X(GET_AVAILABLE_FILTERS)     \
    X(CAN_MULTI_MEASUREMENT)     \
    X(ENABLE_MULTI_MEASUREMENT)  \
    X(DISABLE_MULTI_MEASUREMENT) \
    X(GET_ACTIVE_FILTERS)

#define NXBASE_MESSAGE_TEXT(name) #name,
const char PO_BotschaftenNamen[ANZAHL_BOTSCHAFTEN + 1][kBotschaftNameWidth] = {
    NXBASE_MESSAGES(NXBASE_MESSAGE_TEXT) "ANZAHL_BOTSCHAFTEN"};
#undef NXBASE_MESSAGE_TEXT

namespace {
#define NXBASE_MESSAGE_NUMBER(name) name,
constexpr int kNumbers[] = {NXBASE_MESSAGES(NXBASE_MESSAGE_NUMBER)};
#undef NXBASE_MESSAGE_NUMBER

constexpr bool EachAtItsNumber() {
    for (int n = 0; n < static_cast<int>(std::size(kNumbers)); ++n) {
        if (kNumbers[n] != n) return false;
    }
    return true;
}
static_assert(std::size(kNumbers) == ANZAHL_BOTSCHAFTEN, "one name per message");
static_assert(EachAtItsNumber(), "the names stand in the order of the message numbers");
}  // namespace

namespace nxbase {

const char* MessageName(int alNumber) {
    if (alNumber < 0 || alNumber >= ANZAHL_BOTSCHAFTEN) return "";
    return PO_BotschaftenNamen[alNumber];
}

int NumberOfCommandText(std::string_view asCommand) {
    int offset = 0;
    std::string_view name = asCommand;
    std::size_t bang = asCommand.find('!');
    if (bang != std::string_view::npos && asCommand.substr(0, bang) == "ANSWER") {
        offset = kAnswerOffset;
        // Token 1: the text after the first "!" up to the next one.
        std::size_t end = asCommand.find('!', bang + 1);
        name = asCommand.substr(
            bang + 1, end == std::string_view::npos ? std::string_view::npos : end - bang - 1);
    }
    // Every message passes here several times: a hash look-up, built once,
    // in place of comparing with 135 names. The names are unique, so the
    // first match of the table's order is the only one.
    static const std::unordered_map<std::string_view, int> numbers = [] {
        std::unordered_map<std::string_view, int> table;
        for (int n = 0; n < ANZAHL_BOTSCHAFTEN; ++n) table.emplace(PO_BotschaftenNamen[n], n);
        return table;
    }();
    auto at = numbers.find(name);
    return at == numbers.end() ? -1 : offset + at->second;
}

std::string CommandTextOfNumber(int alNumber) {
    if (alNumber >= 0 && alNumber < ANZAHL_BOTSCHAFTEN) return PO_BotschaftenNamen[alNumber];
    int answered = alNumber - kAnswerOffset;
    if (answered >= 0 && answered < ANZAHL_BOTSCHAFTEN) {
        return std::string(kAnswerPrefix) + PO_BotschaftenNamen[answered];
    }
    return std::string();
}

void AppendEncoded(std::string& asOut, const char* pData, std::size_t alSize) {
    // Most data holds neither byte: one copy. (No data may come as a null
    // pointer, as from an emptied block, which memchr must not be given.)
    if (alSize == 0) return;
    if (std::memchr(pData, '\x00', alSize) == nullptr &&
        std::memchr(pData, '\x01', alSize) == nullptr) {
        asOut.append(pData, alSize);
        return;
    }
    std::size_t specials = 0;
    for (std::size_t i = 0; i < alSize; ++i) specials += static_cast<unsigned char>(pData[i]) <= 1;
    std::size_t at = asOut.size();
    asOut.resize(at + alSize + specials);
    char* out = asOut.data() + at;
    for (std::size_t i = 0; i < alSize; ++i) {
        char c = pData[i];
        if (c == '\x00' || c == '\x01') {
            *out++ = '\x01';
            *out++ = c == '\x00' ? '\x0A' : '\x01';
        } else {
            *out++ = c;
        }
    }
}

std::string EncodeBytes(const char* pData, std::size_t alSize) {
    std::string out;
    AppendEncoded(out, pData, alSize);
    return out;
}

std::string DecodeBytes(const char* pData, std::size_t alSize) {
    std::string out(pData, alSize);
    out.resize(DecodeInPlace(out.data(), out.size()));
    return out;
}

std::size_t StuffedDecoder::Decode(char* pData, std::size_t alSize) {
    // The state in a local: a member could be changed by the stores through
    // pData, as far as the compiler knows, and be reloaded for every byte.
    bool escaped = amEscaped;
    std::size_t out = 0;
    for (std::size_t i = 0; i < alSize; ++i) {
        const char c = pData[i];
        if (escaped) {
            escaped = false;
            pData[out++] = c == '\x0A' ? '\x00' : '\x01';
        } else if (c == '\x01') {
            escaped = true;
        } else {
            pData[out++] = c;
        }
    }
    amEscaped = escaped;
    return out;
}

std::size_t DecodeInPlace(char* pData, std::size_t alSize) {
    StuffedDecoder decoder;
    std::size_t out = decoder.Decode(pData, alSize);
    // The lone 0x01 gave no byte yet, so there is room for it.
    if (decoder.EndsWithLoneEscape()) pData[out++] = '\x01';
    return out;
}

namespace {

void Replace(MyMemoryBlock& axBlock, const std::string& asBytes) {
    MyMemoryBlock replaced(static_cast<long>(asBytes.size()));
    replaced.Put(asBytes.data(), static_cast<long>(asBytes.size()));
    axBlock = std::move(replaced);
}

}  // namespace

void EncodeBlock(MyMemoryBlock& axBlock) {
    Replace(axBlock,
            EncodeBytes(axBlock.GetDatenZeiger(), static_cast<std::size_t>(axBlock.Len())));
}

void DecodeBlock(MyMemoryBlock& axBlock) {
    Replace(axBlock,
            DecodeBytes(axBlock.GetDatenZeiger(), static_cast<std::size_t>(axBlock.Len())));
}

}  // namespace nxbase
