#include "LatencySamples.h"

#include <algorithm>
#include <cmath>

namespace quarn::loadbench {

void LatencySamples::append(const LatencySamples& other) {
    samples_.insert(samples_.end(), other.samples_.begin(), other.samples_.end());
}

double LatencySamples::percentileMicroseconds(double p) const {
    if (samples_.empty()) {
        return 0;
    }
    std::vector<std::uint64_t> sorted = samples_;
    auto rank = static_cast<std::size_t>(std::ceil(p / 100.0 * static_cast<double>(sorted.size())));
    std::size_t index = std::min(sorted.size() - 1, rank == 0 ? 0 : rank - 1);
    std::nth_element(sorted.begin(), sorted.begin() + static_cast<std::ptrdiff_t>(index),
                     sorted.end());
    return static_cast<double>(sorted[index]) / 1e3;
}

} // namespace quarn::loadbench
