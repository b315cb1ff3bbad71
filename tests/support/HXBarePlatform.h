// A host with nothing on it, for tests that answer only the calls in question.
#pragma once

#include "support/HXMadeUpMachine.h"

class HXBarePlatform : public HXMadeUpMachine {
  public:
    HXBarePlatform() : HXMadeUpMachine("host  self_region_heft=1\n") {}
};
