// The command tree of `s2s`, parsed by CLI11: groups ("share", "task") hold commands, and each
// command declares its options once (an OptionSpec table) for parsing, the strict checks and its
// --help page. Every parse error, whatever the command, exits with kExitUsage.
#ifndef S2S_TOOLS_S2S_COMMAND_LINE_H
#define S2S_TOOLS_S2S_COMMAND_LINE_H

#include <functional>
#include <memory>
#include <string>
#include <vector>

#include "tools/s2s/options.h"

namespace CLI {
class App;
}

namespace s2s_cli {

// One command: what its --help page says and what runs once its command line parsed.
struct Command {
    std::string name;         // the word on the command line: "sync", "add"
    std::string usage;        // "s2s sync (--task FILE | ...)"
    std::string description;  // a few lines under the usage
    std::vector<OptionSpec> options;
    std::string epilogue;  // printed after the options, may be empty
    std::function<int(const Options&)> run;
};

class CommandLine {
  public:
    // `main_help` is the whole --help page of `s2s` itself.
    explicit CommandLine(const std::string& main_help);
    ~CommandLine();
    CommandLine(const CommandLine&) = delete;
    CommandLine& operator=(const CommandLine&) = delete;

    CLI::App* Root();
    // A group of commands; `help` is its whole --help page, also shown (on standard error, as a
    // usage error) when the group is named without a command.
    CLI::App* AddGroup(CLI::App* parent, const std::string& name, const std::string& help);
    void AddCommand(CLI::App* parent, const Command& command);

    // Parses `args` (without the program name) and runs the chosen command; the exit code.
    int Run(const std::vector<std::string>& args);
    // "s2s help WORDS...": the --help page of the command the words name (they stop at the first
    // option); an unknown command is a usage error.
    int Help(const std::vector<std::string>& words);

  private:
    struct Impl;
    std::unique_ptr<Impl> impl_;
};

}  // namespace s2s_cli

#endif  // S2S_TOOLS_S2S_COMMAND_LINE_H
