// A ProcessControl driven by a TestHost, built from a command line, for in-process tests.
#pragma once

#include <memory>
#include <string>
#include <vector>

#include "src/ProcessControl.h"
#include "tests/support/TestHost.h"

namespace testsupport {

// The recorder's required options, valid, with the status output discarded.
std::vector<std::string> RecorderArgs(std::vector<std::string> extra = {});

class ProcessHarness {
  public:
    explicit ProcessHarness(std::vector<std::string> args);
    ~ProcessHarness();

    Orvane::ProcessControl& Process() { return *process_; }
    TestHost& Host() { return *host_; }
    bool Initialize() { return process_->Initialize(); }

  private:
    std::vector<std::string> args_;
    std::vector<char*> argv_;
    std::shared_ptr<TestHost> host_;
    std::unique_ptr<Orvane::ProcessControl> process_;
};

}  // namespace testsupport
