#include "zbd/RecentForms.h"

#include "zbd/ZBDPlugIn.h"

namespace zbd {

void RecentForms::keep(std::weak_ptr<const ZBDPlugIn> plugIn) {
    {
        const std::lock_guard lock(_mutex);
        if (_keeping.size() < capacity) {
            _keeping.push_back(std::move(plugIn));
            return;
        }
        _keeping[_oldest].swap(plugIn);
        _oldest = (_oldest + 1) % capacity;
    }
    if (const auto displaced = plugIn.lock()) displaced->forgetForm();
}

} // namespace zbd
