#include "zbd/RecentForms.h"

#include <gtest/gtest.h>

#include <tuple>

namespace {

using zbd::RecentForms;

TEST(RecentForms, WorthKeepingIsWhatComesBackBeforeManyOthers) {
    RecentForms forms;
    auto [number, isAgain] = forms.countMade(0);
    EXPECT_FALSE(isAgain) << "the first time";
    for (const std::size_t others : {std::size_t{0}, RecentForms::capacity - 1, RecentForms::capacity}) {
        for (std::size_t i = 0; i < others; ++i) forms.countMade(0);
        std::tie(number, isAgain) = forms.countMade(number);
        EXPECT_EQ(isAgain, others < RecentForms::capacity) << others;
    }
}

TEST(RecentForms, WhatWasKeptFirstGoesFirst) {
    RecentForms forms;
    const auto keep = [&] {
        const auto kept = std::make_shared<int>();
        forms.keep(kept);
        return std::weak_ptr<int>(kept);
    };
    const auto first = keep();
    const auto second = keep();
    for (std::size_t i = 2; i < RecentForms::capacity; ++i) keep();
    EXPECT_FALSE(first.expired());
    keep();
    EXPECT_TRUE(first.expired());
    EXPECT_FALSE(second.expired());
    keep();
    EXPECT_TRUE(second.expired());
}

} // namespace
