// nxmsg: the command-line peer of the post office. Sends one message with
// typed values and prints the answer, or listens under a name and prints
// every command it receives.
#include <algorithm>
#include <chrono>
#include <csignal>
#include <cstdio>
#include <cstdlib>
#include <iostream>
#include <sstream>
#include <string>
#include <string_view>
#include <vector>

#include "nxbase/logfile.h"
#include "nxbase/pipe.h"
#include "nxbase/poapps.h"
#include "nxbase/postoffice.h"
#include "nxbase/strhelp.h"
#include "nxbase/version.h"
#include "toolkit/application.h"

namespace {

constexpr int kExitOk = 0;      // answered with status 0
constexpr int kExitStatus = 1;  // answered with another status
constexpr int kExitUsage = 2;
constexpr int kExitFailed = 3;  // no answer, or no post office

const char kUsage[] =
    "Usage: nxmsg [--as NAME] [--expect TYPES] APP MESSAGE [VALUE...]\n"
    "       nxmsg [--as NAME] --send APP MESSAGE [VALUE...]\n"
    "       nxmsg --listen NAME\n"
    "Sends MESSAGE (a name such as GET_DEVICE_NAME, or its number) to the\n"
    "application APP, starting APP from the registry when needed, waits for\n"
    "the answer and prints its status (0 done, 1 refused, 2 not supported) and\n"
    "its bytes.\n"
    "\n"
    "VALUEs are written into the data block in order:\n"
    "  b:5  one byte   s:49  a 16-bit short   i:-3  a 32-bit int\n"
    "  (numbers decimal, or hexadecimal after 0x: b:0x1f)\n"
    "  str:text  a string (with its closing zero byte)   hex:0a0b  raw bytes\n"
    "\n"
    "  --as NAME        the sender's application name (default nxmsg)\n"
    "  --expect TYPES   decode the answer after its status byte, e.g.\n"
    "                   --expect str,i   (types b, s, i, str)\n"
    "  --send           send without waiting for an answer\n"
    "  --dde            talk through DDE on the D-Bus session bus only\n"
    "  --listen NAME    run a post office named NAME that prints every command\n"
    "                   and answers with the default handler; Ctrl-C ends it\n"
    "  --timeout S      give up after S seconds, starting APP included\n"
    "                   (default 30)\n"
    "\n"
    "Exit status: 0 answered with status 0, 1 answered with another status,\n"
    "2 usage error, 3 no answer or no post office.\n";

struct UsageError : std::runtime_error {
    using std::runtime_error::runtime_error;
};

// A value of b:, s: or i:: decimal, or hexadecimal after "0x", with an
// optional "-" ("010" is ten, not octal eight).
long ParseNumber(const std::string& text, long low, long high) {
    std::string_view digits(text);
    const bool negative = digits.substr(0, 1) == "-";
    if (negative) digits.remove_prefix(1);
    const bool hex = digits.substr(0, 2) == "0x" || digits.substr(0, 2) == "0X";
    if (hex) digits.remove_prefix(2);
    long long magnitude = 0;
    if (digits.substr(0, 1) == "-" ||
        !StringHelpers::ParseInteger(digits, magnitude, hex ? 16 : 10) ||
        (negative ? -magnitude : magnitude) < low || (negative ? -magnitude : magnitude) > high) {
        throw UsageError("not a number in range: " + text);
    }
    return static_cast<long>(negative ? -magnitude : magnitude);
}

void AppendValue(MyMemoryBlock& block, const std::string& value) {
    std::size_t colon = value.find(':');
    if (colon == std::string::npos) throw UsageError("a value needs a type: " + value);
    std::string type = value.substr(0, colon), text = value.substr(colon + 1);
    if (type == "b") {
        block << static_cast<unsigned char>(ParseNumber(text, -128, 255));
    } else if (type == "s") {
        block << static_cast<short>(ParseNumber(text, -32768, 65535));
    } else if (type == "i") {
        block << static_cast<int>(ParseNumber(text, -2147483648L, 4294967295L));
    } else if (type == "str") {
        block << String(text);
    } else if (type == "hex") {
        if (text.size() % 2 != 0) throw UsageError("hex needs pairs of digits: " + text);
        for (std::size_t i = 0; i < text.size(); i += 2) {
            block << static_cast<unsigned char>(ParseNumber("0x" + text.substr(i, 2), 0, 255));
        }
    } else {
        throw UsageError("unknown value type: " + type);
    }
}

std::string Hex(const MyMemoryBlock& block) {
    std::string hex;
    char digits[4];
    for (long i = 0; i < block.Len(); ++i) {
        std::snprintf(digits, sizeof digits, "%02x",
                      static_cast<unsigned char>(block.GetDatenZeiger()[i]));
        if (i > 0) hex += ' ';
        hex += digits;
    }
    return hex;
}

const char* const kAnswerTypes[] = {"b", "s", "i", "str"};

// Refuses an --expect list with an unknown type, before anything is sent.
void CheckAnswerTypes(const std::string& types) {
    std::stringstream list(types);
    for (std::string type; std::getline(list, type, ',');) {
        if (std::find(std::begin(kAnswerTypes), std::end(kAnswerTypes), type) ==
            std::end(kAnswerTypes)) {
            throw UsageError("unknown type in --expect: \"" + type + "\" (types b, s, i, str)");
        }
    }
}

// The number of a message given by name or by number.
int MessageNumber(const std::string& message) {
    int number = nxbase::NumberOfCommandText(message);
    if (number >= 0) return number;
    if (message.empty() || message.find_first_not_of("0123456789") != std::string::npos) {
        throw UsageError("not a message name: " + message +
                         " (names such as GET_DEVICE_NAME, or numbers 0 to " +
                         std::to_string(ANZAHL_BOTSCHAFTEN - 1) + ")");
    }
    long long value = 0;
    if (!StringHelpers::ParseInteger(message, value) || value >= ANZAHL_BOTSCHAFTEN) {
        throw UsageError("no message has the number " + message + " (0 to " +
                         std::to_string(ANZAHL_BOTSCHAFTEN - 1) + ")");
    }
    return static_cast<int>(value);
}

// The answer after its status byte, as the given types.
std::string Decode(MyMemoryBlock block, const std::string& types) {
    std::ostringstream out;
    signed char status = 0;
    block >> status;
    std::stringstream list(types);
    for (std::string type; std::getline(list, type, ',');) {
        if (type == "b") {
            unsigned char v = 0;
            block >> v;
            out << " " << static_cast<int>(v);
        } else if (type == "s") {
            short v = 0;
            block >> v;
            out << " " << v;
        } else if (type == "i") {
            int v = 0;
            block >> v;
            out << " " << v;
        } else if (type == "str") {
            String v;
            block >> v;
            out << " \"" << v.str() << "\"";
        }
        if (block.ReadPastEnd()) return out.str() + " (the answer is shorter)";
    }
    if (block.Remaining() > 0) out << " (+" << block.Remaining() << " bytes)";
    return out.str();
}

// Prints every command, then hands it on to the post office, whose default
// handler answers it.
void PrintCommand(VELTRAEvent& event) {
    std::cout << event.GetSender() << " -> " << event.GetCommand();
    if (event.GetData().Len() > 0) std::cout << "  " << Hex(event.GetData());
    std::cout << std::endl;
    PostOffice::DummyReceiveFunction(event);
}

void StopListening(int) {
    Application::Get().Quit();
}

int Listen(const std::string& name) {
    PostOffice* office = PostOffice::CreatePostOffice(String(name));
    office->ChangeReceiveFunction(&PrintCommand);
    std::signal(SIGINT, StopListening);
    std::signal(SIGTERM, StopListening);
    std::cerr << "nxmsg: listening as " << name << " (Ctrl-C ends)" << std::endl;
    Application::Get().Execute();
    return kExitOk;
}

int SendOne(const std::string& self, const std::string& app, const std::string& message,
            const std::vector<std::string>& values, const std::string& expect, bool wait,
            int timeout) {
    const int number = MessageNumber(message);
    CheckAnswerTypes(expect);
    MyMemoryBlock data;
    for (const std::string& value : values) AppendValue(data, value);
    // One limit for the whole exchange, starting the peer and CONNECT included.
    const auto deadline = std::chrono::steady_clock::now() + std::chrono::seconds(timeout);
    boost::function<bool()> inTime = [deadline] {
        return std::chrono::steady_clock::now() < deadline;
    };
    PostOffice* office = PostOffice::CreatePostOffice(String(self));
    if (!office->HasApplication(app) && !nxbase::IsApplicationRunning(app)) {
        std::cerr << "nxmsg: " << app
                  << " is not registered and not running (nxreg --help shows how to register it)\n";
        return kExitFailed;
    }
    if (!wait) {
        String command(nxbase::MessageName(number));
        if (!office->Send(app, command, data, inTime)) {
            std::cerr << "nxmsg: cannot send " << message << " to " << app << ": "
                      << office->GetLastError() << "\n";
            return kExitFailed;
        }
        return kExitOk;
    }
    // A well-behaved peer connects first and disconnects at the end, so that
    // a server it started ends when it is no longer needed.
    MyMemoryBlock level, levelAnswer, answer;
    level << static_cast<unsigned char>(2);
    bool connected = number != CONNECT && number != DISCONNECT &&
                     office->SendAndReceive(app, CONNECT, level, levelAnswer, inTime);
    struct Disconnect {
        PostOffice* office;
        const std::string& app;
        bool connected;
        ~Disconnect() {
            if (!connected) return;
            MyMemoryBlock none;
            office->Send(app, DISCONNECT, none);
        }
    } disconnect{office, app, connected};
    if (!office->SendAndReceive(app, number, data, answer, inTime)) {
        std::cerr << "nxmsg: no answer from " << app << " to " << nxbase::MessageName(number)
                  << ": " << office->GetLastError() << "\n";
        return kExitFailed;
    }
    signed char status =
        answer.Len() > 0 ? static_cast<signed char>(answer.GetDatenZeiger()[0]) : -1;
    std::cout << "status " << static_cast<int>(status) << "\nbytes  " << Hex(answer) << "\n";
    if (!expect.empty()) std::cout << "values" << Decode(answer, expect) << "\n";
    return status == 0 ? kExitOk : kExitStatus;
}

}  // namespace

int main(int argc, char** argv) {
    std::vector<std::string> arguments(argv + 1, argv + argc);
    std::string self = "nxmsg", expect, listen;
    bool wait = true;
    int timeout = 30;
    std::vector<std::string> rest;
    try {
        for (std::size_t i = 0; i < arguments.size(); ++i) {
            const std::string& a = arguments[i];
            auto value = [&]() -> std::string {
                if (i + 1 >= arguments.size()) throw UsageError(a + " needs a value");
                return arguments[++i];
            };
            if (a == "--help" || a == "-h") {
                std::cout << kUsage;
                return kExitOk;
            } else if (a == "--version") {
                std::cout << "nxmsg (NxBase) " << nxbase::Version() << "\n";
                return kExitOk;
            } else if (a == "--as") {
                self = value();
            } else if (a == "--expect") {
                expect = value();
            } else if (a == "--listen") {
                listen = value();
            } else if (a == "--dde") {
                Pipe::SetSocketListening(false);
            } else if (a == "--send") {
                wait = false;
            } else if (a == "--timeout") {
                timeout = static_cast<int>(ParseNumber(value(), 1, 86400));
            } else {
                rest.push_back(a);
            }
        }
        LogFile::CreateLogFile("nxmsg");
        // The post office closes its socket when the singletons go.
        struct Cleanup {
            ~Cleanup() { NxSingleton::DeleteAllSingleton(); }
        } cleanup;
        if (!listen.empty()) {
            if (!rest.empty()) throw UsageError("--listen takes no other arguments");
            return Listen(listen);
        }
        if (rest.size() < 2) throw UsageError("an application and a message are needed");
        std::vector<std::string> values(rest.begin() + 2, rest.end());
        return SendOne(self, rest[0], rest[1], values, expect, wait, timeout);
    } catch (const UsageError& error) {
        std::cerr << "nxmsg: " << error.what() << "\n(nxmsg --help shows the usage)\n";
        return kExitUsage;
    } catch (const std::exception& error) {
        std::string what = error.what();
        if (what.find("LumaServer") != std::string::npos)
            what += "\n(" + nxbase::ServerRegistrationHint() + ")";
        std::cerr << "nxmsg: " << what << "\n";
        return kExitFailed;
    }
}
