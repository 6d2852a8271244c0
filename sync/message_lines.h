// The line numbers the sync model's messages carry. Every message of the model names the one
// source file "s2s_sync_obj.cpp" and a line in it, and log readers and scripts match on both, so
// the numbers are fixed here whatever the sources look like: one table for the whole model, in
// line order, so that two messages never claim one line by mistake.
#ifndef S2S_SYNC_MESSAGE_LINES_H
#define S2S_SYNC_MESSAGE_LINES_H

namespace S2S {

constexpr int kLineNoWeekday = 87;
constexpr int kLineUnknownMode = 93;
constexpr int kLineAlignFailed = 117;
constexpr int kLineReferenceSeconds = 128;
constexpr int kLinePastScheduled = 139;
constexpr int kLinePastWeekly = 156;
constexpr int kLinePastUnsupported = 160;
constexpr int kLineDaySeconds = 209;
constexpr int kLineBadHour = 325;
constexpr int kLineBadMinute = 329;
constexpr int kLineBadPeriod = 334;
constexpr int kLineBadRepeat = 340;
constexpr int kLineRepeatPastDay = 346;
constexpr int kLineBadBegin = 359;
constexpr int kLineBadBeginFields = 367;
constexpr int kLineBadBeginDate = 375;
constexpr int kLineWeekLength = 381;
constexpr int kLineNoWeekdayChosen = 391;
constexpr int kLineBadMode = 405;
constexpr int kLineEmptyServer = 610;
constexpr int kLineEmptyUser = 615;
constexpr int kLineBadSSHPort = 620;
constexpr int kLineEmptyName = 756;
constexpr int kLineEmptyShares = 761;
constexpr int kLineInvalidShare = 770;

}  // namespace S2S

#endif  // S2S_SYNC_MESSAGE_LINES_H
