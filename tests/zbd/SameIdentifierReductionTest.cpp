#include "zbd/SameIdentifierReduction.h"

#include "Zembra/ZBProtocol.h"
#include "Zembra/ZBUtilities.h"

#include <gtest/gtest.h>

#include <algorithm>
#include <random>
#include <string>
#include <vector>

namespace {

using zbd::SameIdentifierReduction;
using Facts = SameIdentifierReduction::Facts;

/// The answer as a list of candidates' numbers, found by comparing each candidate with everything found so far.
std::vector<std::size_t> plainWalk(const std::vector<Facts>& candidates, std::uint64_t flags) {
    const bool allVersions = (flags & zembra::ZBDiscoverAllVersions) != 0;
    const bool duplicates = allVersions && (flags & zembra::ZBDiscoverDuplicates) != 0;
    std::vector<std::size_t> results;
    for (std::size_t number = 0; number < candidates.size(); ++number) {
        const Facts& candidate = candidates[number];
        bool isDropped = false;
        for (auto found = results.begin(); found != results.end(); ++found) {
            const Facts& other = candidates[*found];
            if (other.identifier != candidate.identifier || duplicates) continue;
            const auto order = candidate.version
                                   ? zembra::compareVersionString(*candidate.version, other.version.value_or("<none>"))
                                   : std::weak_ordering::equivalent;
            if (allVersions && order != 0) continue;
            bool wins = order > 0;
            if (order == 0 && candidate.onSystemVolume != other.onSystemVolume)
                wins = candidate.onSystemVolume;
            else if (order == 0)
                wins = candidate.lastModified > other.lastModified;
            if (wins) results.erase(found);
            isDropped = !wins;
            break;
        }
        if (!isDropped) results.push_back(number);
    }
    return results;
}

std::vector<std::size_t> reduced(const std::vector<Facts>& candidates, std::uint64_t flags) {
    SameIdentifierReduction results(flags);
    for (std::size_t number = 0; number < candidates.size(); ++number) {
        const Facts& facts = candidates[number];
        if (!results.admit(facts)) continue;
        results.add(facts, {{"number", number}});
    }
    const std::size_t size = results.encodedSize();
    std::vector<std::size_t> numbers;
    std::size_t sizeOfForms = 0;
    for (const auto& form : results.takeForms()) {
        numbers.push_back(*form.uint64("number"));
        sizeOfForms += platform::compactSize(form);
    }
    EXPECT_EQ(size, sizeOfForms);
    return numbers;
}

TEST(SameIdentifierReduction, AnswersLikeAWalkOverAllResults) {
    std::mt19937 random(20261123);
    const auto pick = [&](int count) { return std::uniform_int_distribution(0, count - 1)(random); };
    const std::vector<std::optional<std::string>> versions{std::nullopt, "1.2", "1.10", "01.2", "2", "<none>", ""};
    for (int round = 0; round < 4000; ++round) {
        std::vector<Facts> candidates(static_cast<std::size_t>(pick(12)));
        for (Facts& facts : candidates) {
            facts = {std::string(1, static_cast<char>('a' + pick(3))),
                     versions[static_cast<std::size_t>(pick(static_cast<int>(versions.size())))], pick(3) == 0,
                     pick(3)};
        }
        for (const std::uint64_t flags : {0U, 1U, 4U, 5U}) {
            ASSERT_EQ(reduced(candidates, flags), plainWalk(candidates, flags))
                << "round " << round << " flags " << flags;
        }
    }
}

} // namespace
