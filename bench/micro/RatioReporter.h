#pragma once
// The console report, followed by each measured operation beside its floor
// (the bare primitive or library call it is built on) and their ratio.

#include <benchmark/benchmark.h>

#include <map>
#include <string>
#include <vector>

namespace quarn::bench {

class RatioReporter : public benchmark::ConsoleReporter {
public:
    // Colours only on a terminal.
    RatioReporter();
    void ReportRuns(const std::vector<Run>& reports) override;
    void Finalize() override;

private:
    std::map<std::string, double> realTimes_; // by benchmark name, in its time unit
};

} // namespace quarn::bench
