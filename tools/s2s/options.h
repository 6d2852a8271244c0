// Command-line options of `s2s`: each command declares its options once, as a table of
// OptionSpec, and the same table drives parsing (command_line.h), the strict value checks and
// the --help text. Options is what a command reads back after a successful parse.
#ifndef S2S_TOOLS_S2S_OPTIONS_H
#define S2S_TOOLS_S2S_OPTIONS_H

#include <map>
#include <string>
#include <vector>

namespace s2s_cli {

struct OptionSpec {
    std::string name;        // long name without the dashes: "server-ip"
    std::string value_name;  // empty for a flag; otherwise shown in help: "ADDRESS"
    bool repeatable;         // may be given more than once (values are collected in order)
    std::string help;        // one line
};

// A command's parsed command line. The parser has already refused unknown options, missing
// values, values given to flags and repeated single options; numbers are checked here, when the
// command reads them, so the message can say what the number is for.
class Options {
  public:
    bool Has(const std::string& name) const { return values_.count(name) != 0; }
    // The value of a single option, or `fallback` when it was not given.
    std::string Get(const std::string& name, const std::string& fallback = "") const;
    // Every value of a repeatable option, in command-line order.
    std::vector<std::string> GetAll(const std::string& name) const;
    const std::vector<std::string>& Positional() const { return positional_; }

    // Reads a whole unsigned decimal number no greater than `max` (no sign, no spaces, no
    // trailing text). On failure `error` names the option and the value.
    bool GetUnsigned(const std::string& name, unsigned long long max, unsigned long long& out,
                     std::string& error) const;

    // Filled by the parser: the values of an option that was given, and the arguments that are
    // not options (everything after "--" included).
    void Set(const std::string& name, std::vector<std::string> values);
    void SetPositional(std::vector<std::string> args) { positional_ = std::move(args); }

  private:
    std::map<std::string, std::vector<std::string>> values_;
    std::vector<std::string> positional_;
};

// Strict unsigned decimal: digits only, at most `max`.
bool ParseUnsigned(const std::string& text, unsigned long long max, unsigned long long& out);

}  // namespace s2s_cli

#endif  // S2S_TOOLS_S2S_OPTIONS_H
