#pragma once
// The one table the tool prints: each measure with the daemon's figure, the
// floor's, their ratio, the goal and whether it is met.

#include <optional>
#include <string>
#include <vector>

namespace quarn::loadbench {

class ResultTable {
public:
    enum class Goal {
        None,
        RatioAtMost,  // quarnd / floor <= bound
        RatioAtLeast, // quarnd / floor >= bound
        ValueAtMost,  // quarnd <= bound (no floor)
    };
    struct Row {
        std::string measure;
        std::string unit;
        double quarnd = 0;
        std::optional<double> floor = std::nullopt;
        Goal goal = Goal::None;
        double bound = 0;
    };

    void add(Row row) { rows_.push_back(std::move(row)); }
    // A measure that could not be taken, with the reason.
    void skip(std::string measure, std::string reason);

    void print() const;
    // Whether every goal was met.
    bool allMet() const;

private:
    static std::optional<bool> met(const Row& row);
    static std::string goalText(const Row& row);

    std::vector<Row> rows_;
    std::vector<std::pair<std::string, std::string>> skipped_;
};

} // namespace quarn::loadbench
