// What a transport hands to the post office for every received message: who
// sent it, the command text (a message name, or "ANSWER!" and a name) and the
// decoded data block.
#ifndef NXBASE_VELTRAEVENT_H_
#define NXBASE_VELTRAEVENT_H_

#include <string>

#include "nxbase/export.h"
#include "nxbase/mymemblo.h"

class NXBASE_EXPORT VELTRAEvent {
  public:
    VELTRAEvent() = default;
    VELTRAEvent(std::string asSender, std::string asCommand, MyMemoryBlock axData)
        : amSender(std::move(asSender)), amCommand(std::move(asCommand)), amData(axData) {}

    const std::string& GetSender() const { return amSender; }
    const std::string& GetCommand() const { return amCommand; }
    MyMemoryBlock& GetData() { return amData; }
    const MyMemoryBlock& GetData() const { return amData; }

  private:
    std::string amSender;
    std::string amCommand;
    MyMemoryBlock amData;
};

// The plain function through which a transport delivers events.
using ReceiveFunction = void (*)(VELTRAEvent&);

#endif  // NXBASE_VELTRAEVENT_H_
