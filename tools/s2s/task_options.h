// The options that set a sync task's fields, shared by `s2s sync` (one run of a task given on the
// command line) and `s2s task add|update` (a task handed to the sync service): one table gives
// both commands their option lines, in the same order and with the same meaning, and one function
// writes the options given over a task map.
#ifndef S2S_TOOLS_S2S_TASK_OPTIONS_H
#define S2S_TOOLS_S2S_TASK_OPTIONS_H

#include <string>
#include <vector>

#include "s2s_pobject.h"
#include "tools/s2s/options.h"

namespace s2s_cli {

enum class TaskOptionsFor { kSync, kService };

// The task field options a command offers, with their help lines, then --password-file.
std::vector<OptionSpec> TaskFieldOptions(TaskOptionsFor command);

// The field options a command offers that name a task field (not --task, not --password-file):
// `s2s sync` refuses them beside a task file.
std::vector<std::string> TaskFieldOptionNames(TaskOptionsFor command);

// Writes the field options given over the task map `map` (the keys of SyncTask2PObj): a string
// option replaces its key, --share the whole share list, a flag sets its bit and its --no- form
// clears it, numbers are checked against their range. false with `error` (a usage error) on a
// value that does not parse or a flag given with its --no- form.
bool ApplyTaskFieldOptions(const Options& opts, S2S::PObject& map, std::string& error);

}  // namespace s2s_cli

#endif  // S2S_TOOLS_S2S_TASK_OPTIONS_H
