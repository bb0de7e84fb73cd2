#include "platform/framework/CommandLine.h"

#include <cctype>
#include <cerrno>
#include <climits>
#include <cmath>
#include <cstdlib>

CommandLine::CommandLine(int argc, char** argv) {
    for (int i = 0; i < argc; ++i) args_.emplace_back(argv[i] ? argv[i] : "");
}

bool CommandLine::Find(const std::string& name, std::string& value) const {
    const std::string flag = "-" + name;
    bool found = false;
    for (size_t i = 1; i + 1 < args_.size(); ++i) {
        if (args_[i] == flag) {
            value = args_[i + 1];
            found = true;
            ++i;
        }
    }
    return found;
}

bool CommandLine::ParseInt(const std::string& text, int& value) {
    if (text.empty() || text.size() > 64) return false;
    if (!std::isdigit(static_cast<unsigned char>(text[0])) && text[0] != '-' && text[0] != '+')
        return false;  // strtoll would skip leading blanks
    errno = 0;
    char* end = nullptr;
    long long parsed = std::strtoll(text.c_str(), &end, 10);
    if (errno != 0 || end == text.c_str() || *end != '\0') return false;
    if (parsed < INT_MIN || parsed > INT_MAX) return false;
    value = static_cast<int>(parsed);
    return true;
}

bool CommandLine::ParseDouble(const std::string& text, double& value) {
    if (text.empty() || text.size() > 64) return false;
    errno = 0;
    char* end = nullptr;
    double parsed = std::strtod(text.c_str(), &end);
    if (errno != 0 || end == text.c_str() || *end != '\0' || !std::isfinite(parsed)) return false;
    value = parsed;
    return true;
}

std::string CommandLine::Request() const {
    bool version = false;
    for (size_t i = 1; i < args_.size(); ++i) {
        if (args_[i] == "--help" || args_[i] == "-h") return "help";
        version = version || args_[i] == "--version";
    }
    return version ? "version" : "";
}

std::vector<std::string> CommandLine::CheckShape(const std::set<std::string>& known) const {
    auto isOption = [&](const std::string& arg) {
        return arg.size() > 1 && arg[0] == '-' && known.count(arg.substr(1)) > 0;
    };
    std::vector<std::string> faults;
    for (size_t i = 1; i < args_.size();) {
        const std::string& arg = args_[i];
        if (arg.size() < 2 || arg[0] != '-') {
            faults.push_back("unexpected argument \"" + arg + "\"");
            ++i;
        } else if (!isOption(arg)) {
            faults.push_back("unknown option " + arg);
            // Its value, if it seems to have one, goes with it.
            i += i + 1 < args_.size() && !isOption(args_[i + 1]) ? 2 : 1;
        } else if (i + 1 >= args_.size() || isOption(args_[i + 1])) {
            faults.push_back(arg + " needs a value");
            ++i;
        } else {
            i += 2;
        }
    }
    return faults;
}
