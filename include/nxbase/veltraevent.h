// What a transport hands to the post office for every received message: who
// sent it, the command text (a message name, or "ANSWER!" and a name) and the
// decoded data block, and which connection it came in on, so that the
// answer goes back the same way.
#ifndef NXBASE_VELTRAEVENT_H_
#define NXBASE_VELTRAEVENT_H_

#include <cstdint>
#include <string>

#include "nxbase/export.h"
#include "nxbase/msgcat.h"
#include "nxbase/mymemblo.h"

class NXBASE_EXPORT VELTRAEvent {
  public:
    VELTRAEvent() = default;
    VELTRAEvent(std::string asSender, std::string asCommand, MyMemoryBlock axData,
                std::uint64_t alChannel = 0)
        : amSender(std::move(asSender)),
          amCommand(std::move(asCommand)),
          amData(std::move(axData)),
          amChannel(alChannel) {}

    const std::string& GetSender() const { return amSender; }
    const std::string& GetCommand() const { return amCommand; }
    // The command's message number (nxbase::NumberOfCommandText), looked up
    // once: every stage of the post office asks for it.
    int GetNumber() const {
        if (amNumber == kNotLookedUp) amNumber = nxbase::NumberOfCommandText(amCommand);
        return amNumber;
    }
    MyMemoryBlock& GetData() { return amData; }
    const MyMemoryBlock& GetData() const { return amData; }
    // The socket connection it came in on (0: none, e.g. from DDE).
    std::uint64_t GetChannel() const { return amChannel; }

  private:
    static constexpr int kNotLookedUp = -2;
    std::string amSender;
    std::string amCommand;
    MyMemoryBlock amData;
    std::uint64_t amChannel = 0;
    mutable int amNumber = kNotLookedUp;
};

// The plain function through which a transport delivers events.
using ReceiveFunction = void (*)(VELTRAEvent&);

#endif  // NXBASE_VELTRAEVENT_H_
