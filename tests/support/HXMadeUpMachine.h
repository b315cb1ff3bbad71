// A machine made up as text, with the real machine's command line, files, queues and signals.
#pragma once

#include "platform/linux/HXLinuxServices.h"
#include "platform/replay/HXReplayPlatform.h"

#include <memory>
#include <string>

struct HXMadeUpParts {
    explicit HXMadeUpParts(const std::string &text);
    HXLinuxServices realServices;
    std::unique_ptr<const HXMachine> machine;
};

// The current platform while it lives. `text` is a machine file without its first line, in which two blanks
// stand for the TAB before a field.
class HXMadeUpMachine : private HXMadeUpParts, public HXReplayPlatform {
  public:
    explicit HXMadeUpMachine(const std::string &text);
    ~HXMadeUpMachine() override;
};
