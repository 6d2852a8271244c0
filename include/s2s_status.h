// Status codes of the transport, the stream format and the IPC path: 0 is success, a negative
// number names a failure. Both ends of a connection share these numbers (a peer may send one back
// inside a reply), so they must never be renumbered.
#ifndef S2S_STATUS_H
#define S2S_STATUS_H

#include "s2s_export.h"

namespace S2S {

enum Status : int {
    kStatusSuccessful = 0,
    kStatusInterrupted = -1,
    kStatusIOError = -2,
    kStatusSystemError = -3,
    kStatusInvalidArgument = -4,
    kStatusProtocolError = -5,
    kStatusAuthenticationFailure = -6,
    kStatusServerError = -7,
    kStatusEventConflict = -8,
    kStatusConnectionTimeout = -9,
    kStatusIncompatibleVersion = -10,
    kStatusNoSuchEntry = -11,
    kStatusInvalidUsername = -12,
    kStatusPasswordMismatch = -13,
    kStatusZemDisabled = -14,
    kStatusUserQuotaNotEnough = -15,
    kStatusDiskFull = -16,
    kStatusSyncFolderMissing = -17,
    kStatusViewInvalid = -18,
    kStatusNoPermission = -19,
    kStatusEventPathMissing = -20,
    kStatusAbortedByFlag = -21,
    kStatusLocalDiskFull = -22,
    kStatusFileLocked = -23,
    kStatusCertVerifyFail = -24,
    kStatusReadOnly = -25,
};

// The fixed English text of a status, looked up by its absolute value; "Unknown error" past 25.
S2S_EXPORT const char* StatusMessage(int status);

}  // namespace S2S

#endif  // S2S_STATUS_H
