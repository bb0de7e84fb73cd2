// CommandLine: the process arguments as `-name value` pairs.
//
// Find answers the option readers (BaseProcess::GetArgument_*, FrameworkOptions::Read): when an
// option is given twice the last one wins. CheckShape then says whether the whole line reads as
// pairs of known options, so that a misspelt option ends the start instead of being ignored.
//
// Thread-safe after construction (read-only).
#pragma once

#include <set>
#include <string>
#include <vector>

class CommandLine {
  public:
    CommandLine(int argc, char** argv);
    // True and the value when `-name` is given with a value.
    bool Find(const std::string& name, std::string& value) const;
    // Whole decimal number within int range; false when absent or not a number.
    static bool ParseInt(const std::string& text, int& value);
    static bool ParseDouble(const std::string& text, double& value);

    // What the line asks for besides a run: "--help" or "-h" anywhere, else "--version"
    // anywhere, else "" (a run).
    std::string Request() const;
    // Walks the line as `-name value` pairs and returns one message per fault, in order:
    // "unknown option -inptu", "-kct needs a value", "unexpected argument \"x\"". `known` holds
    // the option names without their '-'. A value that is itself a known option counts as a
    // missing value (a negative number or any other text is a value).
    std::vector<std::string> CheckShape(const std::set<std::string>& known) const;

  private:
    std::vector<std::string> args_;  // argv[0] included
};
