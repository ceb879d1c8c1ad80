#include "zbd/ZBDUserPrefs.h"

#include "Zembra/ZBProtocol.h"

namespace zbd {

ZBDUserPrefs::ZBDUserPrefs(platform::Preferences& preferences) : _preferences(preferences) {
    _preferences.addDomain(zembra::preferencesDomain);
}

platform::Value ZBDUserPrefs::exclusions() const {
    static_cast<void>(_preferences.synchronize(zembra::preferencesDomain)); // what cannot be read stays as it was
    return _preferences.value(zembra::preferencesDomain, zembra::exclusionsPreference);
}

} // namespace zbd
