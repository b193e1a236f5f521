// Result codes of the transport (Channel, PStream, IPC) and of anything
// above it that passes them on: 0 for success, a negative value for a
// failure whose magnitude indexes one fixed table of messages.
#ifndef S2S_RESULT_CODES_H_
#define S2S_RESULT_CODES_H_

#include "S2S/export.h"

namespace S2S {

enum ResultCode : int {
  kSuccessful = 0,
  kInterrupted = -1,
  kIOError = -2,
  kSystemError = -3,
  kInvalidArgument = -4,
  kProtocolError = -5,
  kAuthenticationFailure = -6,
  kServerError = -7,
  kEventConflict = -8,
  kConnectionTimeout = -9,
  kIncompatibleVersion = -10,
  kNoSuchEntry = -11,
  kInvalidUsername = -12,
  kPasswordMismatch = -13,
  kQRMDisabled = -14,
  kUserQuotaNotEnough = -15,
  kDiskFull = -16,
  kSyncFolderMissing = -17,
  kViewMissing = -18,
  kNoPermission = -19,
  kEventPathMissing = -20,
  kAbortedByFlag = -21,
  kLocalDiskFull = -22,
  kFileLocked = -23,
  kSSLVerifyFail = -24,
  kReadOnly = -25,
};

// Number of entries in the message table (codes 0 to -25).
constexpr int kResultCodeCount = 26;

// Returns the message for result code `r`: the table entry at -r when r is
// 0 or negative and above -26, otherwise "Unknown error". Never null; the
// text is static.
S2S_EXPORT const char* ResultMessage(int r);

}  // namespace S2S

#endif  // S2S_RESULT_CODES_H_
