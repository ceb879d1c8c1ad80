#include "zbd/SameIdentifierReduction.h"

#include "Zembra/ZBProtocol.h"
#include "Zembra/ZBUtilities.h"

#include <gtest/gtest.h>

#include <algorithm>
#include <random>

namespace {

using platform::Dictionary;
using platform::MutableDictionary;
using Facts = zbd::SameIdentifierReduction::Facts;

/// The answer as a list of candidates' numbers, found by comparing each candidate with everything found so far.
std::vector<std::size_t> plainWalk(const std::vector<Facts>& candidates, std::uint64_t flags) {
    const bool allVersions = (flags & zembra::ZBDiscoverAllVersions) != 0;
    const bool duplicates = allVersions && (flags & zembra::ZBDiscoverDuplicates) != 0;
    std::vector<std::size_t> results;
    for (std::size_t number = 0; number < candidates.size(); ++number) {
        const Facts& candidate = candidates[number];
        const auto orderTo = [&](std::size_t result) {
            if (!candidate.version) return std::weak_ordering::equivalent;
            return zembra::compareVersionString(*candidate.version, candidates[result].version.value_or("<none>"));
        };
        const auto found = std::find_if(results.begin(), results.end(), [&](std::size_t result) {
            return candidates[result].identifier == candidate.identifier && (!allVersions || orderTo(result) == 0);
        });
        if (found != results.end() && !duplicates) {
            const auto rank = [](const Facts& facts) { return std::pair(facts.onSystemVolume, facts.lastModified); };
            const auto order = orderTo(*found);
            if ((order == 0 ? rank(candidate) <=> rank(candidates[*found]) : order) <= 0) continue;
            results.erase(found);
        }
        results.push_back(number);
    }
    return results;
}

TEST(SameIdentifierReduction, AnswersLikeAWalkOverAllResults) {
    const auto formOf = [](std::size_t number) -> MutableDictionary { return {{"name", std::string(number, 'x')}}; };
    const std::optional<std::string_view> versions[] = {std::nullopt, "1.2", "1.10", "01.2", "2", "<none>", ""};
    std::mt19937 random(20261123);
    for (int round = 0; round < 4000; ++round) {
        std::vector<Facts> candidates(random() % 12, Facts{std::string_view(), {}});
        for (Facts& facts : candidates) {
            facts = {std::string_view("abc").substr(random() % 3, 1), versions[random() % 7], random() % 3 == 0};
            facts.lastModified = static_cast<std::int64_t>(random() % 3);
        }
        for (const std::uint64_t flags : {0U, 1U, 4U, 5U}) {
            zbd::SameIdentifierReduction results(flags);
            for (std::size_t number = 0; number < candidates.size(); ++number) {
                if (results.admit(candidates[number])) results.add(candidates[number], formOf(number));
            }
            std::vector<Dictionary> expected;
            std::size_t size = 0;
            for (const std::size_t number : plainWalk(candidates, flags)) {
                expected.push_back(formOf(number));
                size += platform::compactSize(expected.back());
            }
            ASSERT_EQ(results.encodedSize(), size);
            std::vector<Dictionary> answers;
            for (const auto& answer : results.takeForms()) answers.push_back(answer.form());
            ASSERT_EQ(answers, expected) << "round " << round << " flags " << flags;
        }
    }
}

} // namespace
