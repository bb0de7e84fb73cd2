// INotifyObserver: the components' one channel to the host, implemented by ProcessControl.
//
// The stream buffer calls it on its filing thread, the data controller on its upload thread,
// ProcessControl itself on the message thread; every operation is safe for concurrent callers
// and returns after the framework call has returned. Held as a plain, non-owning pointer
// (nobody deletes through it, hence no virtual destructor).
#pragma once

#include <map>
#include <string>

#include "platform/framework/VqMessages.h"
#include "platform/framework/VqResult.h"

namespace Orvane {

class INotifyObserver {
  public:
    // Stamps the request with the streaming id and sends it to the parent stream.
    virtual VqResult notifyGetAWSTokenRequest(GetAWSSecureTokenRequest& request) = 0;
    virtual VqResult notifyLastSequenceNumNotify(LastSequenceNumNotify& message) = 0;
    // Process state 7 with `code`; the module stops taking samples and cutting files. Must not
    // be called on the stream buffer's filing thread (it joins that thread).
    virtual void notifyModuleError(unsigned int code) = 0;
    // Process state 6 with `code`.
    virtual void notifyModuleWarn(unsigned int code) = 0;
    // Process state 4, code 0.
    virtual void notifyModuleExecute() = 0;
    virtual VqProcessState GetModuleStatus() = 0;
    // Sends the entries (one "UploadInfo" entry in practice) to the parent stream.
    virtual void notifyTransmissionStatus(const std::map<std::string, std::string>& entries) = 0;

  protected:
    ~INotifyObserver() = default;
};

}  // namespace Orvane
