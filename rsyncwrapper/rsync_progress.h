// Internal: reads rsync's --info=progress2 lines and its --stats block.
#ifndef KARO_RSYNC_PROGRESS_H_
#define KARO_RSYNC_PROGRESS_H_

#include <string>

#include "karo/rsync_wrapper.h"

namespace KARO {
namespace Backup {
namespace detail {

class ProgressParser {
 public:
  explicit ProgressParser(const RsyncWrapper::ProgressHandler& handler)
      : handler_(handler) {}

  // Takes one line of rsync's output (without its \r or \n). Returns true
  // when it was a progress or statistics line, which then is not rsync's
  // chatter; a progress line is passed to the handler.
  bool Feed(const std::string& line);
  const RsyncWrapper::TransferStats& stats() const { return stats_; }

 private:
  bool FeedProgress(const std::string& line);
  bool FeedStats(const std::string& line);

  const RsyncWrapper::ProgressHandler& handler_;
  RsyncWrapper::TransferStats stats_;
};

}  // namespace detail
}  // namespace Backup
}  // namespace KARO

#endif  // KARO_RSYNC_PROGRESS_H_
