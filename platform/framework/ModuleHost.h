// IModuleHost: what drives a module: delivers the host's messages and the samples, and
// receives what the module sends. BaseProcess owns one host.
//
// Threads: Prepare and Run are called on the thread that calls BaseProcess::Initialize and
// Execute; Run delivers messages on that thread and samples on threads of its own. The On*
// notifications come on whichever thread the module sends from (upload thread, filing
// thread) and may be concurrent with each other and with Run.
#pragma once

#include "platform/framework/ProcessReadings.h"
#include "platform/framework/VqMessages.h"
#include "platform/framework/VqResult.h"

class BaseProcess;

class IModuleHost {
  public:
    virtual ~IModuleHost() = default;

    // After the module's initializeProcess: open the input, check the set-up. False ends
    // Initialize with failure; the host logs why.
    virtual bool Prepare(BaseProcess& process) = 0;
    // After startProcess: deliver the connection reply, credentials and samples; return when
    // the module is to end. Execute then delivers the disconnection request and stops.
    virtual void Run(BaseProcess& process) = 0;

    // What the module sent to the parent stream (already written to the status output).
    virtual void OnTokenRequest(const GetAWSSecureTokenRequest&) {}
    virtual void OnLastSequenceNumNotify(const LastSequenceNumNotify&) {}
    virtual void OnTransmissionStatus(const TransferStatusNotify&) {}
    virtual void OnProcessStatus(VqProcessState, unsigned int /*code*/) {}

    // Adds what the host counts (input reopenings, clock re-basings) to `readings`. Any thread,
    // concurrently with Run; it must not block. The base counts nothing.
    virtual void AddReadings(ProcessReadings&) const {}
};
