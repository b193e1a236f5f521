// The command protocol between the client's rsync wrapper and this server's
// command handler: statuses, command names and limits. The grammar of
// command files and replies is in doc/protocol.md.
#ifndef S2S_SERVER_PROTOCOL_H_
#define S2S_SERVER_PROTOCOL_H_

#include <stddef.h>

namespace S2S {
namespace server {

// Statuses a reply carries. Numbers stay clear of rsync's exit codes (0-35)
// and of the wrapper's own (250-252).
enum Status : int {
  kOk = 0,
  kUnknownCommand = 43,      // an old server has no such command
  kAttributesRefused = 202,  // share attributes not taken, or malformed
  kAlreadyPaired = 207,      // dry-run pairing: this client is the paired one
  kConflicts = 214,          // shares fed by another client; answer lists them
  kMalformed = 240,          // command file too large, garbled or incomplete
  kBadId = 241,              // a share, task, client or request id refused
  kRegistryFailure = 242,    // the registry could not be read or written
  kUnknownShare = 243,       // no such share on this server
  kServiceDisabled = 244,    // the service is switched off
  kPairedElsewhere = 245,    // bound to another single client
  kNotSyncing = 246,         // finish of a sync this client does not hold
  kNotPaired = 247,          // an old server not paired with this client
};

// Largest command file the handler reads (early input is at most 5120
// bytes; larger ones come through the spool module).
const size_t kMaxCommandFile = 64 * 1024;

// How long after its arrival a command may still be applied. The client
// waits 60 seconds for an answer; what is left is for the reply's way back.
const int kCommandBudgetSeconds = 50;

// The upload spool: what all pending uploads may hold together, and the age
// after which an entry of any spool directory is abandoned and removed.
const size_t kMaxSpool = 64 * kMaxCommandFile;
const int kSpoolStaleSeconds = 600;

// The protocol version "S2S_GetProtocolVer" reports; above 0 means
// multi-source pairing.
const int kProtocolVersion = 1;

// Modules of the daemon besides the shares'.
const char kCommandModule[] = "s2scmd";
const char kSpoolModule[] = "s2sspool";
const char kKeyModule[] = "s2skeys";

}  // namespace server
}  // namespace S2S

#endif  // S2S_SERVER_PROTOCOL_H_
