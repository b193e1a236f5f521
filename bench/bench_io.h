// Blocking whole-buffer reads and writes for the benchmarks' raw socket
// baselines.
#ifndef S2S_BENCH_BENCH_IO_H_
#define S2S_BENCH_BENCH_IO_H_

#include <unistd.h>

#include <cstddef>

namespace s2s_bench {

// Reads or writes exactly `n` bytes on a blocking descriptor; false on an
// error or the end of the stream first.
inline bool ReadAll(int fd, char* buf, size_t n) {
  while (n > 0) {
    ssize_t r = read(fd, buf, n);
    if (r <= 0) return false;
    buf += r;
    n -= static_cast<size_t>(r);
  }
  return true;
}

inline bool WriteAll(int fd, const char* buf, size_t n) {
  while (n > 0) {
    ssize_t r = write(fd, buf, n);
    if (r <= 0) return false;
    buf += r;
    n -= static_cast<size_t>(r);
  }
  return true;
}

}  // namespace s2s_bench

#endif  // S2S_BENCH_BENCH_IO_H_
