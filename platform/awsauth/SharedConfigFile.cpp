#include "platform/awsauth/SharedConfigFile.h"

#include <cctype>
#include <fstream>
#include <sstream>

namespace awsauth {

namespace {

std::string Trim(const std::string& text) {
    size_t start = text.find_first_not_of(" \t\r");
    if (start == std::string::npos) return "";
    size_t end = text.find_last_not_of(" \t\r");
    return text.substr(start, end - start + 1);
}

std::string ReadWhole(const std::string& path) {
    std::ifstream in(path);
    std::stringstream text;
    text << in.rdbuf();
    return text.str();
}

}  // namespace

std::map<std::string, SharedConfigFile::Section> SharedConfigFile::Parse(const std::string& text) {
    std::map<std::string, Section> sections;
    Section* current = nullptr;
    std::istringstream lines(text);
    std::string line;
    while (std::getline(lines, line)) {
        if (!line.empty() && (line[0] == ' ' || line[0] == '\t')) continue;  // nested setting
        line = Trim(line);
        if (line.empty() || line[0] == '#' || line[0] == ';') continue;
        if (line[0] == '[') {
            size_t close = line.find(']');
            current =
                close == std::string::npos ? nullptr : &sections[Trim(line.substr(1, close - 1))];
            continue;
        }
        size_t equals = line.find('=');
        if (current == nullptr || equals == std::string::npos) continue;
        std::string key = Trim(line.substr(0, equals));
        if (!key.empty()) (*current)[key] = Trim(line.substr(equals + 1));
    }
    return sections;
}

SharedConfigFile SharedConfigFile::Load(const Environment& environment) {
    SharedConfigFile files;
    const std::string home = environment("HOME");
    files.configPath_ = environment("AWS_CONFIG_FILE");
    if (files.configPath_.empty()) files.configPath_ = home + "/.aws/config";
    files.credentialsPath_ = environment("AWS_SHARED_CREDENTIALS_FILE");
    if (files.credentialsPath_.empty()) files.credentialsPath_ = home + "/.aws/credentials";
    for (const char* variable : {"AWS_DEFAULT_PROFILE", "AWS_PROFILE"}) {
        std::string name = environment(variable);
        if (!name.empty()) {
            files.profileName_ = name;
            files.explicitProfile_ = true;
        }
    }
    // "[profile NAME]" names NAME; "[default]" and, as the CLI accepts it, "[profile default]"
    // name the default profile. Other bare names in the config file are not profiles.
    for (auto& [name, section] : Parse(ReadWhole(files.configPath_))) {
        if (name.rfind("profile ", 0) == 0) {
            files.config_[Trim(name.substr(8))] = section;
        } else if (name == "default") {
            files.config_.emplace(name, section);
        }
    }
    files.credentials_ = Parse(ReadWhole(files.credentialsPath_));
    return files;
}

bool SharedConfigFile::Profile(const std::string& name, Section& out) const {
    auto inConfig = config_.find(name);
    auto inCredentials = credentials_.find(name);
    if (inConfig == config_.end() && inCredentials == credentials_.end()) return false;
    out.clear();
    if (inConfig != config_.end()) out = inConfig->second;
    if (inCredentials != credentials_.end()) {
        for (const auto& [key, value] : inCredentials->second) out[key] = value;
    }
    return true;
}

}  // namespace awsauth
