#pragma once

#include <algorithm>
#include <cstddef>
#include <cstdio>
#include <string>
#include <vector>

namespace bench {

/// One figure per round. Rounds alternate between what is measured and its reference, so that a slower or faster minute
/// of the machine meets both.
class Series {
public:
    void add(double value) { _values.push_back(value); }

    double median() const {
        std::vector<double> sorted = _values;
        std::sort(sorted.begin(), sorted.end());
        const std::size_t middle = sorted.size() / 2;
        return sorted.size() % 2 != 0 ? sorted[middle] : (sorted[middle - 1] + sorted[middle]) / 2;
    }
    double least() const { return *std::min_element(_values.begin(), _values.end()); }
    double greatest() const { return *std::max_element(_values.begin(), _values.end()); }

    /// Round by round, so that each combines neighbours in time.
    Series over(const Series& reference) const {
        return with(reference, [](double value, double other) { return value / other; });
    }
    Series plus(const Series& other) const {
        return with(other, [](double value, double added) { return value + added; });
    }
    Series minus(const Series& other) const {
        return with(other, [](double value, double taken) { return value - taken; });
    }
    Series times(double factor) const {
        Series product;
        for (const double value : _values) product.add(value * factor);
        return product;
    }

private:
    template <class F> Series with(const Series& other, F&& combine) const {
        Series combined;
        for (std::size_t i = 0; i < _values.size(); ++i) combined.add(combine(_values[i], other._values[i]));
        return combined;
    }

    std::vector<double> _values;
};

/// What a median is meant to be. A table tells when it is not; nothing else follows.
struct Goal {
    enum class Bound { none, atMost, atLeast };
    Bound bound = Bound::none;
    double value = 0;

    std::string verdictOn(double median) const {
        if (bound == Bound::none) return "";
        char text[64];
        std::snprintf(text, sizeof text, "%s %.2f", bound == Bound::atMost ? "at most" : "at least", value);
        const bool isMissed = bound == Bound::atMost ? median > value : median < value;
        return isMissed ? std::string("**missed:** ") + text : text;
    }
};
inline Goal atMost(double value) { return {Goal::Bound::atMost, value}; }
inline Goal atLeast(double value) { return {Goal::Bound::atLeast, value}; }

inline void printHeader(const std::string& title) {
    std::printf("\n| %-56s | %-18s | %6s | %-14s | %-24s |\n|---|---:|---:|---:|---|\n", title.c_str(), "median",
                "ratio", "spread", "goal");
}

/// One row of a table: the figure, and its ratio to the reference with the spread over the rounds.
inline void printRow(const std::string& name, const Series& figures, const char* unit, const Series& reference,
                     const Goal& goal = {}) {
    const Series ratio = figures.over(reference);
    const int decimals = ratio.median() < 0.1 ? 4 : 2;
    std::printf("| %-56s | %9.1f %-8s | %6.*f | %5.*f to %5.*f | %-24s |\n", name.c_str(), figures.median(), unit,
                decimals, ratio.median(), decimals, ratio.least(), decimals, ratio.greatest(),
                goal.verdictOn(ratio.median()).c_str());
}
/// A figure that others are compared with.
inline void printReference(const std::string& name, const Series& figures, const char* unit) {
    std::printf("| %-56s | %9.1f %-8s | %6s | %14s | %24s |\n", name.c_str(), figures.median(), unit, "1", "", "");
}
/// A figure that stands for itself, with its own spread and goal.
inline void printFigure(const std::string& name, const Series& figures, const char* unit, const Goal& goal = {}) {
    std::printf("| %-56s | %9.1f %-8s | %6s | %5.1f to %5.1f | %-24s |\n", name.c_str(), figures.median(), unit, "",
                figures.least(), figures.greatest(), goal.verdictOn(figures.median()).c_str());
}

} // namespace bench
