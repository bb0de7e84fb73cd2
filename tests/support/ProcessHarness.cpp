#include "tests/support/ProcessHarness.h"

namespace testsupport {

std::vector<std::string> RecorderArgs(std::vector<std::string> extra) {
    std::vector<std::string> args = {"-bucketname",    "rec",  "-uploadinterval", "10",
                                     "-authretrytime", "1000", "-bufferfullsize", "3",
                                     "-kct",           "h264", "-status",         "/dev/null",
                                     "-streamingid",   "cam1"};
    args.insert(args.end(), extra.begin(), extra.end());
    return args;
}

ProcessHarness::ProcessHarness(std::vector<std::string> args) : args_(std::move(args)) {
    args_.insert(args_.begin(), "stream-file-recorder");
    for (auto& a : args_) argv_.push_back(a.data());
    argv_.push_back(nullptr);
    host_ = std::make_shared<TestHost>();
    process_ =
        std::make_unique<Orvane::ProcessControl>(static_cast<int>(args_.size()), argv_.data());
    process_->SetHost(host_);
}

ProcessHarness::~ProcessHarness() {
    // Whatever the test left running is stopped before the module goes.
    process_->stopProcess();
    process_.reset();
}

}  // namespace testsupport
