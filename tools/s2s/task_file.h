// Task files: a sync task written as the task map of the sync model in JSON, one object whose
// keys are the map's keys ("name", "share_list", "server_ip", "schedule_mode", ...). The file is
// checked strictly before anything else sees it: unknown or repeated keys, wrong kinds and
// out-of-range numbers are errors that name the key, so a typo never silently becomes a default.
#ifndef S2S_TOOLS_S2S_TASK_FILE_H
#define S2S_TOOLS_S2S_TASK_FILE_H

#include <nlohmann/json.hpp>
#include <string>

#include "s2s_pobject.h"
#include "s2s_source_guard.h"
#include "s2s_sync_obj.h"

namespace s2s_cli {

// Parses the JSON text of a task into a task map. On failure `error` says what is wrong and where.
bool ParseTaskJson(const std::string& text, S2S::PObject& map, std::string& error);

// Reads a task file (a regular file of at most 1 MiB) and parses it. `has_password` tells whether
// it carries "pswd"; such a file must not be readable by other users.
bool LoadTaskFile(const std::string& path, S2S::PObject& map, bool& has_password,
                  std::string& error);

// LoadTaskFile, then the map turned into a task by the sync model's own conversion.
bool LoadTask(const std::string& path, S2S::SyncTask& task, bool& has_password, std::string& error);
// The same, also giving the run options the file carries (GuardOptionsFromMap).
bool LoadTask(const std::string& path, S2S::SyncTask& task, S2S::SourceGuardOptions& guard,
              bool& has_password, std::string& error);

// The run options a task file may carry beside the task map: "allow_empty_source" (a share's
// empty folder may empty the receiver's copy) and "max_delete" ("N" or "N%", the deletion limit
// of each share's run).
bool GuardOptionsFromMap(const S2S::PObject& map, S2S::SourceGuardOptions& options,
                         std::string& error);

// The task map as JSON, without the password: the task's keys with the kinds of a task file
// (booleans, signed numbers), other keys as PObjectToJson gives them.
nlohmann::json TaskMapToJson(const S2S::PObject& map);
// Any value: maps as objects, arrays, integers as unsigned numbers, strings; a "pswd" key is left
// out at every level.
nlohmann::json PObjectToJson(const S2S::PObject& value);

}  // namespace s2s_cli

#endif  // S2S_TOOLS_S2S_TASK_FILE_H
