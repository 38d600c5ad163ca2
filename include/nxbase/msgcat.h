// The messaging vocabulary: message numbers and their names, the answer
// numbering, and the byte stuffing that keeps zero bytes out of a message's
// data block on the wire. What crosses a process boundary is always the name,
// never the number.
#ifndef NXBASE_MSGCAT_H_
#define NXBASE_MSGCAT_H_

#include <cstddef>
#include <string>
#include <string_view>

#include "nxbase/export.h"

class MyMemoryBlock;

enum PO_Botschaften {
    CONNECT = 0,
    DISCONNECT = 1,
    LOCK = 2,
    UNLOCK = 3,
    CANCEL_REQUEST = 4,
    IS_APP_READY = 5,
    GET_APP_VERSION = 6,
    GET_TOP_WINDOW_POS = 7,
    GET_SW_VERSION = 8,
    GET_SERIE_NR = 9,
    GET_DISPLAY_STRING = 10,
    IS_A_LPM = 11,
    IS_A_DENSITOMETER = 12,
    GET_DEVICE_TYPE = 13,
    GET_DEVICE_NAME = 14,
    SPECTRUM_REQUEST = 15,
    INDEX_VALUE_REQUEST = 16,
    TIME_REQUEST = 17,
    TIME_DOWNLOAD = 18,
    STD_NAME_DOWNLOAD = 19,
    GET_VAL_NR_VALUE = 20,
    STD_NAME_REQUEST = 21,
    NAME_18_REQUEST = 22,
    DEL_VAL_NR = 23,
    GET_VAL_NR_LIB = 24,
    SET_VAL_NR_LIB = 25,
    PARAMETER_REQUEST = 26,
    PARAMETER_DOWNLOAD = 27,
    EXEC_MEASUREMENT = 28,
    EXEC_WHITE_MEASUREMENT = 29,
    EXEC_REF_MEASUREMENT = 30,
    WHITE_REF_REQUEST = 31,
    ALT_TAB_ACTIV_REQUEST = 32,
    GET_VAL_NR_TAB = 33,
    SET_VAL_NR_TAB = 34,
    NEW_MEASURE_REQUEST = 35,
    MEAS_CONTROL_DOWNLOAD = 36,
    MEAS_CONTROL_REQUEST = 37,
    NEW_USER_GUIDE_REQUEST = 38,
    USER_GUIDE_DOWNLOAD = 39,
    SET_VAL_NR_VALUE = 40,
    C_DOWNLOAD = 41,
    SPECTRUM_DOWNLOAD = 42,
    MESSUNG_AUSGELOEST = 43,
    STATUSAENDERUNG = 44,
    NOTIFY_MESSUNG = 45,
    NOTIFY_MESSUNG_AUS = 46,
    NOTIFY_STATUS = 47,
    IS_READY = 48,
    OPTIONEN_EINSTELLEN = 49,
    SCAN_LPM = 50,
    MOVE_ABSOLUT = 51,
    MOVE_RELATIVE = 52,
    MOVE_HOME = 53,
    MOVE_UP = 54,
    MOVE_DOWN = 55,
    MOVE_WHITE_REF_POS = 56,
    OUTPUT_ACTUAL_POSITION = 57,
    INITIALIZE_DEVICE = 58,
    SCAN_LUMIPROBE = 59,
    SET_DEVICE_ONLINE = 60,
    SET_DEVICE_OFFLINE = 61,
    HOLD_PAPER = 62,
    RELEASE_PAPER = 63,
    SET_DIGITIZING_MODE = 64,
    OUTPUT_DIGITIZING_VALUES = 65,
    CHANGE_BAUDRATE = 66,
    CHANGE_HANDSHAKE = 67,
    OUTPUT_ACTUAL_KEY = 68,
    OUTPUT_LAST_KEY = 69,
    OUTPUT_STATUS = 70,
    CLEAR_STATUS = 71,
    SET_SPECIAL_STATUS = 72,
    CLEAR_SPECIAL_STATUS = 73,
    OUTPUT_SPECIAL_STATUS = 74,
    ACTUAL_ERROR_REQUEST = 75,
    OUTPUT_TYPE = 76,
    OUTPUT_SERIAL_NUMBER = 77,
    OUTPUT_ARTICLE_NUMBER = 78,
    OUTPUT_PRODUCTION_DATE = 79,
    OUTPUT_SOFTWARE_VERSION = 80,
    ENTER_KEY_PRESSED = 81,
    NOTIFY_ENTER_KEY = 82,
    NOTIFY_ENTER_KEY_AUS = 83,
    GET_SPECTRUM_AT_POS = 84,
    SET_TABLE_MODE = 85,
    SET_LIGHT_LEVEL = 86,
    SET_TRANSM_STANDBY_POS = 87,
    GET_ACCESS_CODE = 88,
    RETURN_ACCESS_CODE = 89,
    PROGRAM_KEY = 90,
    DOWNLOAD_PROGRAM = 91,
    DOWNLOAD_ORIGIN_OFFSET = 92,
    DOWNLOAD_TRANS_LAMP_MODE = 93,
    HASA_LUMITABLE = 94,
    HASA_LUMITABLE_T = 95,
    ISA_LUMIPROBE = 96,
    ISA_LPM = 97,
    ISA_DENSITOMETER = 98,
    ISA_VIDIPROBE = 99,
    ISA_LUMI_VIEW = 100,
    FILTER_DOWNLOAD = 101,
    GET_CHILDREN = 102,
    HAS_CHILDREN = 103,
    GET_OBJECT = 104,
    GRADUS_CONNECT = 105,
    NEW_FORMULA = 106,
    MODIFY_OPTIONS = 107,
    FILE_ACT_DRIVE_REQUEST = 108,
    FILE_CHANGE_DRIVE = 109,
    FILE_FORMAT_DRIVE = 110,
    FILE_DISC_SPACE_REQUEST = 111,
    FILE_ACT_DIR_REQUEST = 112,
    FILE_CHANGE_DIR = 113,
    FILE_CREATE_DIR = 114,
    FILE_DELETE_DIR = 115,
    FILE_RENAME_DIR = 116,
    FILE_DELETE_FILE = 117,
    FILE_RENAME_FILE = 118,
    FILE_STATUS_REQUEST = 119,
    FILE_ENTRY_COUNT = 120,
    FILE_ENTRY_REQUEST = 121,
    FILE_CREATE_FILE = 122,
    FILE_ACCESS_START = 123,
    FILE_ACCESS_END = 124,
    FILE_WRITE_TO_FILE = 125,
    FILE_READ_FROM_FILE = 126,
    GET_DEVICE_CATEGORY = 127,
    NETGAUGE_GET_STATUS = 128,
    BRING_APP_WINDOW_TO_FRONT = 129,
    GET_AVAILABLE_FILTERS = 130,
    CAN_MULTI_MEASUREMENT = 131,
    ENABLE_MULTI_MEASUREMENT = 132,
    DISABLE_MULTI_MEASUREMENT = 133,
    GET_ACTIVE_FILTERS = 134,
    ANZAHL_BOTSCHAFTEN = 135  // the number of messages, not a message
};

// Width of one name field of the message table, zero bytes included.
constexpr int kBotschaftNameWidth = 30;
// The message table: field n holds the NUL-padded ASCII name of message n;
// field ANZAHL_BOTSCHAFTEN holds that name and is never searched. It is made
// from one list that the build checks against this enum, name for number.
NXBASE_EXPORT extern const char PO_BotschaftenNamen[ANZAHL_BOTSCHAFTEN + 1][kBotschaftNameWidth];

// The answer to message n is numbered kAnswerOffset + n; its command text is
// "ANSWER!" followed by the name of message n.
constexpr int kAnswerOffset = 1000;
inline constexpr const char* kAnswerPrefix = "ANSWER!";

namespace nxbase {

// The name of message `alNumber` (0..134), or "" for any other number.
NXBASE_EXPORT const char* MessageName(int alNumber);
// The number of a command text: n for the name of message n, 1000 + n for
// "ANSWER!" and that name, -1 for anything else (names compare exactly; one
// hash look-up, whatever the number of messages).
NXBASE_EXPORT int NumberOfCommandText(std::string_view asCommand);
// The command text of message number `alNumber`: its name below 1000,
// "ANSWER!" and the name of message alNumber - 1000 from 1000 on; "" when
// there is no such message.
NXBASE_EXPORT std::string CommandTextOfNumber(int alNumber);

// Byte stuffing of a data block, in place: 0x00 becomes 01 0A, 0x01 becomes
// 01 01. Decoding reverses it; 0x01 followed by anything but 0x0A, or by
// nothing at the end, gives 0x01. The block's positions start afresh.
NXBASE_EXPORT void EncodeBlock(MyMemoryBlock& axBlock);
NXBASE_EXPORT void DecodeBlock(MyMemoryBlock& axBlock);
// The same on plain bytes.
NXBASE_EXPORT std::string EncodeBytes(const char* pData, std::size_t alSize);
// Appends the stuffed form of `alSize` bytes at `pData` to `asOut` (`pData`
// may be null when `alSize` is 0).
NXBASE_EXPORT void AppendEncoded(std::string& asOut, const char* pData, std::size_t alSize);
NXBASE_EXPORT std::string DecodeBytes(const char* pData, std::size_t alSize);
// Decodes `alSize` bytes at `pData` in place (decoding never grows them);
// returns the decoded length.
NXBASE_EXPORT std::size_t DecodeInPlace(char* pData, std::size_t alSize);
// The same on data that arrives in pieces, each decoded in place: a 0x01
// that ends one piece pairs with the first byte of the next.
class NXBASE_EXPORT StuffedDecoder {
  public:
    // Decodes a piece; returns its decoded length.
    std::size_t Decode(char* pData, std::size_t alSize);
    // After the last piece: true when it ended in a lone 0x01, which stands
    // for itself.
    bool EndsWithLoneEscape() const { return amEscaped; }

  private:
    bool amEscaped = false;
};

// The status byte that begins every answer block.
enum AnswerStatus : signed char { kDone = 0, kRefused = 1, kNotSupported = 2 };

}  // namespace nxbase

#endif  // NXBASE_MSGCAT_H_
