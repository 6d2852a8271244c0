// The command tree of `s2s` on CLI11 (see command_line.h).
#include "tools/s2s/command_line.h"

#include <CLI/CLI.hpp>
#include <algorithm>
#include <cstdio>
#include <map>

#include "tools/s2s/commands.h"
#include "tools/s2s/exit_codes.h"

namespace s2s_cli {

namespace {

const char kVersion[] = "s2s 1.0.0";

// What --help shows for one node of the tree: a page written out whole (the program and its
// groups), or a command's page built from its options.
struct HelpPage {
    std::string whole;
    const Command* command = nullptr;
};

using HelpPages = std::map<const CLI::App*, HelpPage>;

bool IsFlag(const CLI::Option* option) {
    return option->get_expected_max() == 0;
}

bool IsPositional(const CLI::Option* option) {
    return option->get_lnames().empty();
}

// Lays a command's page out as "Usage:", the description, one line per option (the help flag
// last) and the epilogue.
class HelpFormatter : public CLI::FormatterBase {
  public:
    explicit HelpFormatter(const HelpPages& pages) : pages_(pages) {}

    std::string make_help(const CLI::App* app, std::string, CLI::AppFormatMode) const override {
        auto it = pages_.find(app);
        if (it == pages_.end()) {
            return "";
        }
        if (it->second.command == nullptr) {
            return it->second.whole;
        }
        const Command& command = *it->second.command;
        std::vector<const CLI::Option*> options;
        for (const CLI::Option* option : app->get_options()) {
            if (!IsPositional(option) && option != app->get_help_ptr()) {
                options.push_back(option);
            }
        }
        options.push_back(app->get_help_ptr());
        std::vector<std::string> heads;
        size_t width = 0;
        for (const CLI::Option* option : options) {
            std::string head = "  --" + option->get_lnames().front();
            if (!IsFlag(option)) {
                head += " " + option->get_type_name();
            }
            width = std::max(width, head.size());
            heads.push_back(head);
        }
        std::string text = "Usage: " + command.usage + "\n\n" + command.description + "\n";
        text += "\nOptions:\n";
        for (size_t i = 0; i < options.size(); ++i) {
            text += heads[i] + std::string(width + 2 - heads[i].size(), ' ') +
                    options[i]->get_description();
            if (options[i]->get_multi_option_policy() == CLI::MultiOptionPolicy::TakeAll) {
                text += " (repeatable)";
            }
            text += "\n";
        }
        if (!command.epilogue.empty()) {
            text += "\n" + command.epilogue;
            if (command.epilogue.back() != '\n') {
                text += "\n";
            }
        }
        return text;
    }

  private:
    const HelpPages& pages_;
};

// The node the command line reached: the last subcommand parsed.
const CLI::App* Reached(const CLI::App& root) {
    const CLI::App* app = &root;
    while (!app->get_subcommands().empty()) {
        app = app->get_subcommands().front();
    }
    return app;
}

std::vector<CLI::App*> Children(CLI::App* app) {
    return app->get_subcommands([](CLI::App*) { return true; });
}

// "unknown share command 'x' (add, remove, list)"
std::string UnknownCommand(const CLI::App* node, const CLI::App* root, const std::string& word) {
    const std::string group = node == root ? "" : node->get_name() + " ";
    std::string known;
    for (const CLI::App* command : node->get_subcommands({})) {
        known += (known.empty() ? "" : ", ") + command->get_name();
    }
    return "unknown " + group + "command '" + word + "' (" + known + ")";
}

// The parser's messages about one option, in the words the rest of the program uses; others are
// returned as they are.
std::string OptionMessage(const CLI::App* reached, const std::string& what) {
    auto named = [&](size_t end) {
        std::string name = what.substr(0, end);
        name.erase(0, name.find_first_not_of('-'));
        const CLI::Option* option = reached->get_option_no_throw("--" + name);
        return std::make_pair("option '--" + name + "'", option);
    };
    size_t at = what.find(" was given a disallowed flag override");
    if (at != std::string::npos) {
        return named(at).first + " takes no value";
    }
    at = what.find(": At Most ");
    if (at != std::string::npos) {
        return named(at).first + " given more than once";
    }
    at = what.find(": ");
    if (at != std::string::npos && what.size() > 8 &&
        what.compare(what.size() - 8, 8, " missing") == 0 &&
        what.find(" required ", at) != std::string::npos) {
        const auto option = named(at);
        return option.first + " needs a value" +
               (option.second != nullptr ? " (" + option.second->get_type_name() + ")" : "");
    }
    at = what.find(": ");
    if (at != std::string::npos && what.find("out of range") != std::string::npos) {
        return named(at).first + ": the value is out of range";
    }
    return what;
}

}  // namespace

struct CommandLine::Impl {
    HelpPages pages;  // read by the formatter the tree below holds, so declared first
    std::map<const CLI::App*, std::unique_ptr<Command>> commands;
    std::map<const CLI::App*, std::vector<std::string>> positional;  // bound to each command
    CLI::App root{"s2s"};
};

CommandLine::CommandLine(const std::string& main_help) : impl_(new Impl) {
    // Subcommands inherit the formatter and the help flag of their parent when they are made.
    impl_->root.formatter(std::make_shared<HelpFormatter>(impl_->pages));
    impl_->root.set_help_flag("-h,--help", "show this help");
    impl_->root.set_version_flag("--version", kVersion);
    impl_->pages[&impl_->root].whole = main_help;
}

CommandLine::~CommandLine() = default;

CLI::App* CommandLine::Root() {
    return &impl_->root;
}

CLI::App* CommandLine::AddGroup(CLI::App* parent, const std::string& name,
                                const std::string& help) {
    CLI::App* group = parent->add_subcommand(name);
    impl_->pages[group].whole = help;
    return group;
}

void CommandLine::AddCommand(CLI::App* parent, const Command& command) {
    CLI::App* app = parent->add_subcommand(command.name);
    auto owned = std::make_unique<Command>(command);
    for (const OptionSpec& row : owned->options) {
        if (row.name == "help") {
            continue;  // the help flag every command inherits
        }
        CLI::Option* option = nullptr;
        if (row.value_name.empty()) {
            // "--flag=value" is refused: a flag is set by being there.
            option = app->add_flag("--" + row.name, row.help)->disable_flag_override();
        } else {
            option = app->add_option("--" + row.name, row.help)->type_name(row.value_name);
        }
        option->multi_option_policy(row.repeatable ? CLI::MultiOptionPolicy::TakeAll
                                                   : CLI::MultiOptionPolicy::Throw);
    }
    // Arguments that are not options are collected for the command to judge, so it can say what
    // it expected.
    app->add_option("args", impl_->positional[app]);
    // Once a command is chosen, later words are its arguments, never another command: a share
    // may be called "list", a task file "sync".
    app->preparse_callback([app](std::size_t) {
        for (CLI::App* up = app->get_parent(); up != nullptr; up = up->get_parent()) {
            for (CLI::App* other : Children(up)) {
                if (other->count() == 0) {
                    other->disabled();
                }
            }
        }
    });
    impl_->pages[app].command = owned.get();
    impl_->commands[app] = std::move(owned);
}

int CommandLine::Help(const std::vector<std::string>& words) {
    CLI::App* node = &impl_->root;
    for (const std::string& word : words) {
        if (word.rfind("-", 0) == 0) {
            break;
        }
        CLI::App* next = nullptr;
        for (CLI::App* command : Children(node)) {
            if (command->get_name() == word) {
                next = command;
            }
        }
        if (next == nullptr) {
            return Fail(kExitUsage, UnknownCommand(node, &impl_->root, word));
        }
        node = next;
    }
    std::fputs(node->help().c_str(), stdout);
    return kExitOK;
}

int CommandLine::Run(const std::vector<std::string>& args) {
    CLI::App& root = impl_->root;
    if (args.empty()) {
        std::fputs(impl_->pages[&root].whole.c_str(), stdout);
        return kExitUsage;
    }
    for (const std::string& arg : args) {
        if (arg == "--") {
            break;
        }
        if (arg == "--password" || arg.rfind("--password=", 0) == 0) {
            return Fail(kExitUsage,
                        "passwords are never given on the command line: use --password-file "
                        "FILE or the environment variable S2S_PASSWORD");
        }
        // The parser would take the next argument as the value of "--at=".
        if (arg.size() > 3 && arg.rfind("--", 0) == 0 && arg.find('=') == arg.size() - 1) {
            return Fail(kExitUsage,
                        "option '" + arg.substr(0, arg.size() - 1) + "' needs a value, not ''");
        }
    }
    std::vector<std::string> reversed(args.rbegin(),
                                      args.rend());  // CLI11 takes them from the back
    try {
        root.parse(reversed);
    } catch (const CLI::CallForHelp&) {
        std::fputs(root.help().c_str(), stdout);
        return kExitOK;
    } catch (const CLI::CallForVersion& version) {
        std::printf("%s\n", version.what());
        return kExitOK;
    } catch (const CLI::ParseError& error) {
        const CLI::App* reached = Reached(root);
        const std::vector<std::string> extra = reached->remaining();
        if (dynamic_cast<const CLI::ExtrasError*>(&error) != nullptr && !extra.empty()) {
            if (impl_->commands.count(reached) != 0 || extra.front().rfind("-", 0) == 0) {
                return Fail(kExitUsage, "unknown option '" + extra.front() + "'");
            }
            return Fail(kExitUsage, UnknownCommand(reached, &root, extra.front()));
        }
        return Fail(kExitUsage, OptionMessage(reached, error.what()));
    }
    const CLI::App* reached = Reached(root);
    auto it = impl_->commands.find(reached);
    if (it == impl_->commands.end()) {
        // A group named without one of its commands.
        std::fputs(impl_->pages[reached].whole.c_str(), stderr);
        return kExitUsage;
    }
    Options opts;
    for (const CLI::Option* option : reached->get_options()) {
        if (IsPositional(option)) {
            opts.SetPositional(impl_->positional[reached]);
        } else if (option->count() > 0 && option != reached->get_help_ptr()) {
            opts.Set(option->get_lnames().front(), option->results());
        }
    }
    return it->second->run(opts);
}

}  // namespace s2s_cli
