#pragma once
// Round-trip times of one run, in nanoseconds, and their percentiles.

#include <cstdint>
#include <vector>

namespace quarn::loadbench {

class LatencySamples {
public:
    void add(std::uint64_t nanoseconds) { samples_.push_back(nanoseconds); }
    void append(const LatencySamples& other);

    std::size_t count() const { return samples_.size(); }
    // `p` in [0, 100], nearest rank; 0 when there are no samples.
    double percentileMicroseconds(double p) const;

private:
    std::vector<std::uint64_t> samples_;
};

} // namespace quarn::loadbench
