// This build has no media host yet: a process started with -input cannot record it.
#include "platform/framework/BaseProcess.h"
#include "platform/logger/Logger.h"

std::shared_ptr<IModuleHost> CreateMediaHost(const FrameworkOptions& options) {
    Logger::Put(4, "platform/framework/MediaHost", "CreateMediaHost", __LINE__,
                "cannot record \"%s\": this build has no media host (only the test host)",
                options.input.c_str());
    return nullptr;
}
