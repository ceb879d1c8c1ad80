#pragma once

#include <algorithm>
#include <cstdio>
#include <string>
#include <vector>

namespace bench {

/// One figure per round. Rounds alternate between what is measured and its reference, so that a slower or faster minute
/// of the machine meets both.
class Series {
public:
    void add(double value) { _values.push_back(value); }
    bool empty() const { return _values.empty(); }

    double median() const {
        std::vector<double> sorted = _values;
        std::sort(sorted.begin(), sorted.end());
        const std::size_t middle = sorted.size() / 2;
        return sorted.size() % 2 != 0 ? sorted[middle] : (sorted[middle - 1] + sorted[middle]) / 2;
    }
    double least() const { return *std::min_element(_values.begin(), _values.end()); }
    double greatest() const { return *std::max_element(_values.begin(), _values.end()); }

    /// Round by round, so that each ratio compares neighbours in time.
    Series over(const Series& reference) const {
        Series ratios;
        for (std::size_t i = 0; i < _values.size(); ++i) ratios.add(_values[i] / reference._values[i]);
        return ratios;
    }

private:
    std::vector<double> _values;
};

/// One row of the table: figure, and ratio to the reference with its spread over the rounds.
inline void printRow(const std::string& name, const Series& figures, const Series* reference, const char* unit) {
    std::printf("| %-52s | %9.1f %-8s |", name.c_str(), figures.median(), unit);
    if (reference == nullptr) {
        std::printf(" %6s | %13s |\n", "1", "");
        return;
    }
    const Series ratio = figures.over(*reference);
    std::printf(" %6.2f | %5.2f to %5.2f |\n", ratio.median(), ratio.least(), ratio.greatest());
}

inline void printHeader(const std::string& title) {
    std::printf("\n| %-52s | %-18s | %6s | %-13s |\n|---|---:|---:|---:|\n", title.c_str(), "median", "ratio",
                "spread");
}

} // namespace bench
