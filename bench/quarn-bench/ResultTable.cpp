#include "ResultTable.h"

#include <fmt/format.h>

#include <cstdio>

namespace quarn::loadbench {

namespace {

std::string figure(double value, const std::string& unit) {
    return fmt::format("{:.1f} {}", value, unit);
}

} // namespace

void ResultTable::skip(std::string measure, std::string reason) {
    skipped_.emplace_back(std::move(measure), std::move(reason));
}

std::optional<bool> ResultTable::met(const Row& row) {
    switch (row.goal) {
    case Goal::None:
        return std::nullopt;
    case Goal::RatioAtMost:
        return row.floor && row.quarnd / *row.floor <= row.bound;
    case Goal::RatioAtLeast:
        return row.floor && row.quarnd / *row.floor >= row.bound;
    case Goal::ValueAtMost:
        return row.quarnd <= row.bound;
    }
    return std::nullopt;
}

std::string ResultTable::goalText(const Row& row) {
    switch (row.goal) {
    case Goal::None:
        return "-";
    case Goal::RatioAtMost:
        return fmt::format("<= {:g}x", row.bound);
    case Goal::RatioAtLeast:
        return fmt::format(">= {:g}x", row.bound);
    case Goal::ValueAtMost:
        return fmt::format("<= {:g} {}", row.bound, row.unit);
    }
    return "-";
}

void ResultTable::print() const {
    std::printf("%-34s %16s %16s %7s %12s  %s\n", "measure", "quarnd", "floor", "ratio", "goal",
                "met");
    for (const auto& row : rows_) {
        const std::string floor = row.floor ? figure(*row.floor, row.unit) : "-";
        const std::string ratio =
            row.floor && *row.floor > 0 ? fmt::format("{:.2f}", row.quarnd / *row.floor) : "-";
        const auto ok = met(row);
        std::printf("%-34s %16s %16s %7s %12s  %s\n", row.measure.c_str(),
                    figure(row.quarnd, row.unit).c_str(), floor.c_str(), ratio.c_str(),
                    goalText(row).c_str(), ok ? (*ok ? "yes" : "NO") : "");
    }
    for (const auto& [measure, reason] : skipped_) {
        std::printf("%-34s not measured: %s\n", measure.c_str(), reason.c_str());
    }
}

bool ResultTable::allMet() const {
    for (const auto& row : rows_) {
        if (met(row) == false) {
            return false;
        }
    }
    return true;
}

} // namespace quarn::loadbench
