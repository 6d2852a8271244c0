// The task field options of `s2s sync` and `s2s task add|update`, and how they set a task map.
#include "tools/s2s/task_options.h"

#include "s2s_source_guard.h"

namespace s2s_cli {

namespace {

enum class Field {
    kNone,      // not a field of the task (--task, --password-file)
    kString,    // replaces the string key
    kShares,    // every value, in order, replaces the share list
    kOn,        // sets the bit key
    kOff,       // clears the bit key (the --no- form of the option before it)
    kUnsigned,  // an unsigned number up to `max`
    kLimit,     // a deletion limit, "N" or "N%"
    kClear,     // empties the string key (the --no- form of the option before it)
};

struct TaskOption {
    const char* name;
    const char* value_name;
    bool repeatable;
    // The help line for each command; null when the command does not offer the option.
    const char* sync_help;
    const char* service_help;
    Field field;
    const char* key;
    unsigned long long max;
};

// In the order both commands list them.
const TaskOption kTaskOptions[] = {
    {"task", "FILE", false, "the task file (JSON task map); replaces --name to --max-bandwidth",
     "the task file (JSON task map); the options below override its keys", Field::kNone, "", 0},
    {"name", "NAME", false, "the task's name (default \"cli\")", "the task's name", Field::kString,
     "name", 0},
    {"id", "N", false, "the task's id (default 0)", nullptr, Field::kUnsigned, "id", ~0ULL},
    {"server", "HOST", false, "the receiving server's host name",
     "the receiving server's host name", Field::kString, "server_name", 0},
    {"server-ip", "ADDRESS", false, "the receiving server's address (tried first)",
     "the receiving server's address (tried first)", Field::kString, "server_ip", 0},
    {"user", "USER", false, "the user the server knows this client by",
     "the user the server knows this client by", Field::kString, "user", 0},
    {"share", "NAME", true, "a registered share to sync",
     "a registered share to sync (the list replaces the task's)", Field::kShares, "share_list", 0},
    {"compress", "", false, "compress data on the wire", "compress data on the wire", Field::kOn,
     "compress", 0},
    {"no-compress", "", false, nullptr, "do not compress data on the wire", Field::kOff, "compress",
     0},
    {"block-level", "", false, "send only the changed blocks of changed files",
     "send only the changed blocks of changed files", Field::kOn, "block", 0},
    {"no-block-level", "", false, nullptr, "send changed files whole", Field::kOff, "block", 0},
    {"ssh", "", false, "reach the server over SSH", "reach the server over SSH", Field::kOn, "ssh",
     0},
    {"no-ssh", "", false, nullptr, "reach the server's rsync daemon directly", Field::kOff, "ssh",
     0},
    {"ssh-port", "PORT", false, "the server's SSH port (also used for encryption keys)",
     "the server's SSH port (also used for encryption keys)", Field::kUnsigned, "ssh_port", 65535},
    {"max-bandwidth", "N", false, "limit each copy to N KiB per second (0: no limit)",
     "limit each copy to N KiB per second (0: no limit)", Field::kUnsigned, "max_bandwidth",
     0xFFFFFFFFULL},
    // `s2s sync` takes the guards as options of its run, beside --exclude.
    {"allow-empty-source", "", false, nullptr, "sync an empty share folder even over a full copy",
     Field::kOn, "allow_empty_source", 0},
    {"no-allow-empty-source", "", false, nullptr, "refuse an empty share folder over a full copy",
     Field::kOff, "allow_empty_source", 0},
    {"max-delete", "N|N%", false, nullptr,
     "refuse a share's run that would delete more than N (or N%)", Field::kLimit, "max_delete", 0},
    {"no-max-delete", "", false, nullptr, "no deletion limit", Field::kClear, "max_delete", 0},
    {"password-file", "FILE", false, "read the password from FILE (mode 600; - for stdin)",
     "read the password from FILE (mode 600; - for stdin)", Field::kNone, "", 0},
};

const char* HelpFor(const TaskOption& option, TaskOptionsFor command) {
    return command == TaskOptionsFor::kSync ? option.sync_help : option.service_help;
}

}  // namespace

std::vector<OptionSpec> TaskFieldOptions(TaskOptionsFor command) {
    std::vector<OptionSpec> options;
    for (const TaskOption& option : kTaskOptions) {
        if (const char* help = HelpFor(option, command)) {
            options.push_back({option.name, option.value_name, option.repeatable, help});
        }
    }
    return options;
}

std::vector<std::string> TaskFieldOptionNames(TaskOptionsFor command) {
    std::vector<std::string> names;
    for (const TaskOption& option : kTaskOptions) {
        if (option.field != Field::kNone && HelpFor(option, command) != nullptr) {
            names.push_back(option.name);
        }
    }
    return names;
}

bool ApplyTaskFieldOptions(const Options& opts, S2S::PObject& map, std::string& error) {
    const TaskOption* previous = nullptr;
    for (const TaskOption& option : kTaskOptions) {
        const TaskOption* on = previous;
        previous = &option;
        if (!opts.Has(option.name)) {
            continue;
        }
        unsigned long long value = 0;
        switch (option.field) {
            case Field::kNone:
                break;
            case Field::kString:
                map[option.key] = opts.Get(option.name);
                break;
            case Field::kShares: {
                S2S::PObject::Array shares;
                for (const std::string& name : opts.GetAll(option.name)) {
                    shares.push_back(S2S::PObject(name));
                }
                map[option.key] = shares;
                break;
            }
            case Field::kOn:
                map[option.key] = true;
                break;
            case Field::kOff:
            case Field::kClear:
                if (opts.Has(on->name)) {
                    error = std::string("--") + on->name + " and --" + option.name +
                            " contradict each other";
                    return false;
                }
                if (option.field == Field::kOff) {
                    map[option.key] = false;
                } else {
                    map[option.key] = "";  // the service reads an empty limit as none
                }
                break;
            case Field::kLimit: {
                S2S::DeleteLimit limit;
                if (!S2S::DeleteLimit::Parse(opts.Get(option.name), limit, error)) {
                    error = std::string("--") + option.name + ": " + error;
                    return false;
                }
                map[option.key] = limit.ToString();
                break;
            }
            case Field::kUnsigned:
                if (!opts.GetUnsigned(option.name, option.max, value, error)) {
                    return false;
                }
                // The task map's 32-bit fields travel as such.
                if (option.max <= 0xFFFFFFFFULL) {
                    map[option.key] = static_cast<unsigned int>(value);
                } else {
                    map[option.key] = value;
                }
                break;
        }
    }
    return true;
}

}  // namespace s2s_cli
