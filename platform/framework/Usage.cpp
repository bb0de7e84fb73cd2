#include "platform/framework/Usage.h"

#include <algorithm>

namespace {

void appendOptions(std::string& text, const std::vector<OptionHelp>& options) {
    size_t width = 0;
    for (const auto& o : options) width = std::max(width, o.name.size() + o.value.size() + 2);
    for (const auto& o : options) {
        std::string left = "  -" + o.name + " " + o.value;
        left.resize(width + 4, ' ');
        text += left + o.meaning +
                (o.defaultValue.empty() ? " (required)" : " (default: " + o.defaultValue + ")") +
                "\n";
    }
}

}  // namespace

std::string UsageText(const std::string& program, const std::vector<OptionHelp>& moduleOptions,
                      const std::vector<OptionHelp>& frameworkOptions, const std::string& example) {
    std::string text = "Usage: " + program + " -input URL";
    for (const auto& o : moduleOptions)
        if (o.defaultValue.empty()) text += " -" + o.name + " " + o.value;
    text += " [options]\n       " + program + " --help | --version\n\n" +
            "Records one stream into segment objects in an S3 bucket or a directory.\n" +
            "\nRecording options:\n";
    appendOptions(text, moduleOptions);
    text += "\nInput, store and output options:\n";
    appendOptions(text, frameworkOptions);
    text +=
        "\nExit status: 0 after a normal run; 1 when the start fails (options, input, "
        "store settings);\n2 when the recorder stopped on a module error; 3 when nothing was "
        "stored because every\nstream file was given up.\n";
    text += "\nExample:\n  " + example + "\n";
    return text;
}
