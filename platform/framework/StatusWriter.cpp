#include "platform/framework/StatusWriter.h"

#include <fcntl.h>
#include <unistd.h>

#include <chrono>
#include <ctime>
#include <nlohmann/json.hpp>

#include "platform/logger/Logger.h"
#include "platform/transfer/UtcTime.h"

namespace {

nlohmann::ordered_json header(const char* message, const std::string& destination) {
    nlohmann::ordered_json j;
    j["time"] = IsoUtcTime(UtcNowMicros());
    j["message"] = message;
    j["destination"] = destination;
    return j;
}

}  // namespace

StatusWriter::~StatusWriter() {
    if (ownsFile_ && file_ != nullptr) std::fclose(file_);
}

bool StatusWriter::Open(const std::string& path) {
    std::lock_guard<std::mutex> lock(mutex_);
    if (path == "-") {
        file_ = stdout;
        ownsFile_ = false;
        return true;
    }
    int fd = Logger::OpenAppend(path);
    if (fd < 0) return false;
    FILE* f = fdopen(fd, "a");
    if (f == nullptr) {
        close(fd);
        return false;
    }
    file_ = f;
    ownsFile_ = true;
    return true;
}

void StatusWriter::writeLine(const std::string& line) {
    std::lock_guard<std::mutex> lock(mutex_);
    if (file_ == nullptr) return;
    std::fputs(line.c_str(), file_);
    std::fputc('\n', file_);
    std::fflush(file_);
}

void StatusWriter::WriteTokenRequest(const std::string& destination,
                                     const GetAWSSecureTokenRequest& m) {
    auto j = header("GetAWSSecureTokenRequest", destination);
    j["streamingId"] = m.streamingId;
    writeLine(j.dump(-1, ' ', false, nlohmann::ordered_json::error_handler_t::replace));
}

void StatusWriter::WriteLastSequenceNumNotify(const std::string& destination,
                                              const LastSequenceNumNotify& m) {
    auto j = header("LastSequenceNumNotify", destination);
    j["entries"] = nlohmann::ordered_json::array();
    for (const auto& e : m.entries) {
        nlohmann::ordered_json entry;
        entry["streamingId"] = e.streamingId;
        entry["sequenceNumber"] = e.sequenceNumber;
        entry["succeeded"] = e.succeeded;
        entry["errorName"] = e.errorName;
        entry["flag"] = e.flag;
        entry["duration"] = e.duration;
        j["entries"].push_back(entry);
    }
    writeLine(j.dump(-1, ' ', false, nlohmann::ordered_json::error_handler_t::replace));
}

void StatusWriter::WriteTransmissionStatus(const std::string& destination,
                                           const TransferStatusNotify& m) {
    auto j = header("TransferStatusNotify", destination);
    j["statusMap"] = nlohmann::ordered_json::object();
    for (const auto& [key, value] : m.statusMap) j["statusMap"][key] = value;
    writeLine(j.dump(-1, ' ', false, nlohmann::ordered_json::error_handler_t::replace));
}

void StatusWriter::WriteProcessStatus(const std::string& destination, VqProcessState state,
                                      unsigned int code) {
    auto j = header("ProcessStatus", destination);
    j["state"] = static_cast<int>(state);
    j["code"] = code;
    writeLine(j.dump(-1, ' ', false, nlohmann::ordered_json::error_handler_t::replace));
}
