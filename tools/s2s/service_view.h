// How the sync service's answers are shown to a person: its tasks, their runs in progress and
// their past runs as aligned tables, times in the local time zone. The maps are those of the
// control replies (docs/service.md); a key that is missing shows as "-".
#ifndef S2S_TOOLS_S2S_SERVICE_VIEW_H
#define S2S_TOOLS_S2S_SERVICE_VIEW_H

#include <string>

#include "s2s_pobject.h"

namespace s2s_cli {

// "Mon 2026-11-23 02:00:00" in local time; "-" for 0 (no time).
std::string FormatLocalTime(unsigned long long epoch);
// `epoch` in the local time zone, written with strftime's `format`.
std::string LocalTimeText(long long epoch, const char* format);
// A task's id in a reply map: "task_id", or the task map's own "id".
unsigned long long TaskIdOf(const S2S::PObject& task);

// `s2s task list`: one line per task (id, name, state, schedule, next run, server, shares).
std::string TaskListTable(const S2S::PObject& tasks);
// `s2s task show ID`: the task as the sync model sees it, then its state and next run.
std::string TaskDetails(const S2S::PObject& task);
// `s2s task status`: one line per task (state, the share being copied, bytes done of the total).
std::string StatusTable(const S2S::PObject& tasks);
// `s2s task history`: one line per run, then one per share.
std::string HistoryText(const S2S::PObject& runs);

// True while a task of a status reply is running or waiting for its turn.
bool AnyActive(const S2S::PObject& tasks);

}  // namespace s2s_cli

#endif  // S2S_TOOLS_S2S_SERVICE_VIEW_H
