// Peak memory of one operation, measured in a fresh process so that neither
// the benchmark's own pages nor an earlier operation's count.

#ifndef KARST_BENCH_PEAK_RSS_H_
#define KARST_BENCH_PEAK_RSS_H_

#include <string>
#include <vector>

namespace karst_bench {

// Runs this binary again (/proc/self/exe) with the given arguments and
// returns what the child printed on its stdout, or "" when it did not exit 0.
// The child reports its own figures: the parent's ru_maxrss for it is no use,
// as Linux carries the high-water mark of the memory a child had before exec
// over, and a forked child had all of the benchmark's.
std::string RunSelf(const std::vector<std::string>& args);

// VmHWM from /proc/self/status: the peak of this process's own memory, in
// KiB, or -1.
long OwnPeakRssKib();

}  // namespace karst_bench

#endif  // KARST_BENCH_PEAK_RSS_H_
