#pragma once
// CPU time of the calling thread: what a floor done by this tool costs,
// independent of what else the machine is busy with.

#include <time.h>

namespace quarn::loadbench {

inline double threadCpuSeconds() {
    timespec now{};
    ::clock_gettime(CLOCK_THREAD_CPUTIME_ID, &now);
    return static_cast<double>(now.tv_sec) + static_cast<double>(now.tv_nsec) / 1e9;
}

} // namespace quarn::loadbench
