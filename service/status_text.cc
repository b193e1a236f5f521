// The runner's statuses in words: the rsync wrapper's and the server's.
#include "karo/rsync_wrapper.h"
#include "service/task_runner.h"

namespace s2s_service {

std::string StatusText(int status) {
  std::string text;
  switch (status) {
    case 0:
      text = "ok";
      break;
    case 5:
      text = "refused by the daemon (user, password or module)";
      break;
    case 10:
      text = "no connection";
      break;
    case 20:
      text = "cancelled";
      break;
    case 23:
      text = "partial transfer";
      break;
    case 25:
      text = "deletions held back";
      break;
    case 30:
    case 35:
      text = "time-out";
      break;
    case 42:
      text = "address lookup failed";
      break;
    case 43:
      text = "command unknown to the server";
      break;
    case 202:
      text = "share attributes refused";
      break;
    case 213:
      text = "no address to try";
      break;
    case 214:
      text = "shares fed by another client";
      break;
    case 240:
      text = "command malformed";
      break;
    case 241:
      text = "a name was refused";
      break;
    case 242:
      text = "server registry failure";
      break;
    case 243:
      text = "no such share on the server";
      break;
    case 244:
      text = "service switched off on the server";
      break;
    case 245:
      text = "the server is paired with another client";
      break;
    case 246:
      text = "the server holds no sync of this client";
      break;
    case 247:
      text = "the server is not paired with this client";
      break;
    case 250:
      text = "rsync could not be started";
      break;
    case 251:
      text = "no reply from the server";
      break;
    case 252:
      text = "incomplete settings";
      break;
    case 253:
      text = "reply from the server too large";
      break;
    case 300:
      text = "share record unreadable";
      break;
    case -1:
      text = "request could not be prepared";
      break;
    default:
      text = "failed";
      break;
  }
  return text + " [" + std::to_string(status) + "]";
}

std::string FailureText(int status) {
  std::string why = KARO::Backup::RsyncWrapper::lastError();
  return StatusText(status) + (why.empty() ? "" : ": " + why);
}

}  // namespace s2s_service
