// Usage: the text that --help prints, made of the module's options and the framework's.
//
// Pure functions; safe on any thread.
#pragma once

#include <string>
#include <vector>

// One option as the usage text shows it: "-name VALUE  meaning (default: ...)".
struct OptionHelp {
    std::string name;          // without the leading '-'
    std::string value;         // placeholder for its value, e.g. "SECONDS"
    std::string defaultValue;  // "" for a required option
    std::string meaning;
};

// The whole usage text: a synopsis (the input and the required module options), the module's
// options (required ones marked), the
// framework's, the exit statuses and `example`, a complete command line. Ends with a newline.
std::string UsageText(const std::string& program, const std::vector<OptionHelp>& moduleOptions,
                      const std::vector<OptionHelp>& frameworkOptions, const std::string& example);
