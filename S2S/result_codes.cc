#include "S2S/result_codes.h"

namespace S2S {
namespace {

// The service's shared vocabulary of failures. Spellings, case and the
// trailing blank of -19 are what every program of the service prints; they
// stay exactly as they are.
const char* const kMessages[kResultCodeCount] = {
    "Successful",
    "Interrupted",
    "I/O error",
    "System error",
    "Invalid argument",
    "Protocal error",
    "Authentication failure",
    "Server error",
    "Event conflict",
    "Connection timeout",
    "Incompatible version",
    "No such entry",
    "Invalid username",
    "Password and username not matched",
    "QRM disabled",
    "User quota not enough",
    "Disk is full",
    "Sync Folder is miss",
    "View missing/invalid",
    "no permission ",
    "pull event by path, but the path is missing",
    "connection about by setting flag",
    "Local Disk is full",
    "file locked or no permission",
    "ssl certificate verify fail",
    "permission is read-only",
};

}  // namespace

const char* ResultMessage(int r) {
  if (r <= 0 && r > -kResultCodeCount) return kMessages[-r];
  return "Unknown error";
}

}  // namespace S2S
