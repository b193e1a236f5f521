// Internal: reads rsync's --info=progress2 lines, its --stats block, the
// count of deletions --max-delete held back and, for a dry run, the
// --itemize-changes lines.
#ifndef KARO_RSYNC_PROGRESS_H_
#define KARO_RSYNC_PROGRESS_H_

#include <string>

#include "karo/rsync_wrapper.h"

namespace KARO {
namespace Backup {
namespace detail {

class ProgressParser {
 public:
  // `itemized`: rsync runs with --itemize-changes.
  ProgressParser(const RsyncWrapper::ProgressHandler& handler, bool itemized)
      : handler_(handler), itemized_(itemized) {}

  // Takes one line of rsync's output (without its \r or \n). Returns true
  // when it was a progress, statistics or itemized line, which then is not
  // rsync's chatter; a progress line is passed to the handler (if any).
  bool Feed(const std::string& line);
  const RsyncWrapper::TransferStats& stats() const { return stats_; }

 private:
  bool FeedProgress(const std::string& line);
  bool FeedStats(const std::string& line);
  bool FeedItem(const std::string& line);

  const RsyncWrapper::ProgressHandler& handler_;
  bool itemized_;
  RsyncWrapper::TransferStats stats_;
};

}  // namespace detail
}  // namespace Backup
}  // namespace KARO

#endif  // KARO_RSYNC_PROGRESS_H_
