// A machine made up as text, with the real machine's command line, files, queues and signals.
#pragma once

#include "platform/linux/HXLinuxServices.h"
#include "platform/replay/HXReplayPlatform.h"

#include <memory>
#include <string>

// The machine that `records` describe: a machine file without its first line, in which two blanks stand for
// the TAB before a field. Null with *reason set when it does not load.
std::unique_ptr<HXMachine> HXLoadMachine(const std::string &records, std::string *reason);

struct HXMadeUpParts {
    explicit HXMadeUpParts(const std::string &text);
    HXLinuxServices realServices;
    std::unique_ptr<const HXMachine> machine;
};

// The current platform while it lives, loaded by HXLoadMachine; a machine with nothing on it unless told.
class HXMadeUpMachine : private HXMadeUpParts, public HXReplayPlatform {
  public:
    explicit HXMadeUpMachine(const std::string &text = "host  self_region_heft=1\n");
    ~HXMadeUpMachine() override;

    using HXMadeUpParts::realServices;
};
