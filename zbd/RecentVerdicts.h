#pragma once

#include "zbd/ZBDatabase.h"

#include <list>
#include <memory>
#include <optional>
#include <vector>

namespace zbd {

/// Which plug-ins of a list fulfil rules, kept for hosts that ask by the rules that others asked by: those of one
/// extension point do. On the service queue only.
class RecentVerdicts {
public:
    /// One for each of the candidates; null for rules that cannot be judged once for all, and for too long ones.
    using Verdicts = std::shared_ptr<const std::vector<bool>>;

    /// `prepared` are the same rules; `knowledge` is the registry's.
    Verdicts verdictsOn(const ZBDPlugIns& candidates, const platform::Dictionary& rules, const MatchRules& prepared,
                        const std::optional<platform::UUID>& knowledge);

private:
    struct Entry {
        platform::Dictionary rules;
        std::weak_ptr<const std::vector<ZBDPlugInRef>> candidates;
        platform::UUID knowledge; // manifests follow it
        Verdicts verdicts;
    };
    std::list<Entry> _entries; // the last used one first
};

} // namespace zbd
