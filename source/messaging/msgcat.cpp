#include "nxbase/msgcat.h"

#include <unordered_map>

#include "nxbase/mymemblo.h"

const char PO_BotschaftenNamen[ANZAHL_BOTSCHAFTEN + 1][kBotschaftNameWidth] = {
    "CONNECT",
    "DISCONNECT",
    "LOCK",
    "UNLOCK",
    "CANCEL_REQUEST",
    "IS_APP_READY",
    "GET_APP_VERSION",
    "GET_TOP_WINDOW_POS",
    "GET_SW_VERSION",
    "GET_SERIE_NR",
    "GET_DISPLAY_STRING",
    "IS_A_LPM",
    "IS_A_DENSITOMETER",
    "GET_DEVICE_TYPE",
    "GET_DEVICE_NAME",
    "SPECTRUM_REQUEST",
    "INDEX_VALUE_REQUEST",
    "TIME_REQUEST",
    "TIME_DOWNLOAD",
    "STD_NAME_DOWNLOAD",
    "GET_VAL_NR_VALUE",
    "STD_NAME_REQUEST",
    "NAME_18_REQUEST",
    "DEL_VAL_NR",
    "GET_VAL_NR_LIB",
    "SET_VAL_NR_LIB",
    "PARAMETER_REQUEST",
    "PARAMETER_DOWNLOAD",
    "EXEC_MEASUREMENT",
    "EXEC_WHITE_MEASUREMENT",
    "EXEC_REF_MEASUREMENT",
    "WHITE_REF_REQUEST",
    "ALT_TAB_ACTIV_REQUEST",
    "GET_VAL_NR_TAB",
    "SET_VAL_NR_TAB",
    "NEW_MEASURE_REQUEST",
    "MEAS_CONTROL_DOWNLOAD",
    "MEAS_CONTROL_REQUEST",
    "NEW_USER_GUIDE_REQUEST",
    "USER_GUIDE_DOWNLOAD",
    "SET_VAL_NR_VALUE",
    "C_DOWNLOAD",
    "SPECTRUM_DOWNLOAD",
    "MESSUNG_AUSGELOEST",
    "STATUSAENDERUNG",
    "NOTIFY_MESSUNG",
    "NOTIFY_MESSUNG_AUS",
    "NOTIFY_STATUS",
    "IS_READY",
    "OPTIONEN_EINSTELLEN",
    "SCAN_LPM",
    "MOVE_ABSOLUT",
    "MOVE_RELATIVE",
    "MOVE_HOME",
    "MOVE_UP",
    "MOVE_DOWN",
    "MOVE_WHITE_REF_POS",
    "OUTPUT_ACTUAL_POSITION",
    "INITIALIZE_DEVICE",
    "SCAN_LUMIPROBE",
    "SET_DEVICE_ONLINE",
    "SET_DEVICE_OFFLINE",
    "HOLD_PAPER",
    "RELEASE_PAPER",
    "SET_DIGITIZING_MODE",
    "OUTPUT_DIGITIZING_VALUES",
    "CHANGE_BAUDRATE",
    "CHANGE_HANDSHAKE",
    "OUTPUT_ACTUAL_KEY",
    "OUTPUT_LAST_KEY",
    "OUTPUT_STATUS",
    "CLEAR_STATUS",
    "SET_SPECIAL_STATUS",
    "CLEAR_SPECIAL_STATUS",
    "OUTPUT_SPECIAL_STATUS",
    "ACTUAL_ERROR_REQUEST",
    "OUTPUT_TYPE",
    "OUTPUT_SERIAL_NUMBER",
    "OUTPUT_ARTICLE_NUMBER",
    "OUTPUT_PRODUCTION_DATE",
    "OUTPUT_SOFTWARE_VERSION",
    "ENTER_KEY_PRESSED",
    "NOTIFY_ENTER_KEY",
    "NOTIFY_ENTER_KEY_AUS",
    "GET_SPECTRUM_AT_POS",
    "SET_TABLE_MODE",
    "SET_LIGHT_LEVEL",
    "SET_TRANSM_STANDBY_POS",
    "GET_ACCESS_CODE",
    "RETURN_ACCESS_CODE",
    "PROGRAM_KEY",
    "DOWNLOAD_PROGRAM",
    "DOWNLOAD_ORIGIN_OFFSET",
    "DOWNLOAD_TRANS_LAMP_MODE",
    "HASA_LUMITABLE",
    "HASA_LUMITABLE_T",
    "ISA_LUMIPROBE",
    "ISA_LPM",
    "ISA_DENSITOMETER",
    "ISA_VIDIPROBE",
    "ISA_LUMI_VIEW",
    "FILTER_DOWNLOAD",
    "GET_CHILDREN",
    "HAS_CHILDREN",
    "GET_OBJECT",
    "GRADUS_CONNECT",
    "NEW_FORMULA",
    "MODIFY_OPTIONS",
    "FILE_ACT_DRIVE_REQUEST",
    "FILE_CHANGE_DRIVE",
    "FILE_FORMAT_DRIVE",
    "FILE_DISC_SPACE_REQUEST",
    "FILE_ACT_DIR_REQUEST",
    "FILE_CHANGE_DIR",
    "FILE_CREATE_DIR",
    "FILE_DELETE_DIR",
    "FILE_RENAME_DIR",
    "FILE_DELETE_FILE",
    "FILE_RENAME_FILE",
    "FILE_STATUS_REQUEST",
    "FILE_ENTRY_COUNT",
    "FILE_ENTRY_REQUEST",
    "FILE_CREATE_FILE",
    "FILE_ACCESS_START",
    "FILE_ACCESS_END",
    "FILE_WRITE_TO_FILE",
    "FILE_READ_FROM_FILE",
    "GET_DEVICE_CATEGORY",
    "NETGAUGE_GET_STATUS",
    "BRING_APP_WINDOW_TO_FRONT",
    "GET_AVAILABLE_FILTERS",
    "CAN_MULTI_MEASUREMENT",
    "ENABLE_MULTI_MEASUREMENT",
    "DISABLE_MULTI_MEASUREMENT",
    "GET_ACTIVE_FILTERS",
    "ANZAHL_BOTSCHAFTEN",
};

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

std::size_t DecodeInPlace(char* pData, std::size_t alSize) {
    std::size_t out = 0;
    for (std::size_t i = 0; i < alSize; ++i) {
        char c = pData[i];
        if (c == '\x01') {
            // A lone 0x01 at the end has no second byte and gives 0x01.
            c = i + 1 < alSize && pData[i + 1] == '\x0A' ? '\x00' : '\x01';
            if (i + 1 < alSize) ++i;
        }
        pData[out++] = c;
    }
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
