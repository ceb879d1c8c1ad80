#pragma once

#include "platform/PrivacyConsent.h"
#include "platform/linux/Root.h"

namespace platform::linux_ {

/// "PVC": grants in `<root>/var/db/PrivacyConsent.vlist`, a dictionary from an application's bundle identifier to a
/// dictionary from service identifier to boolean. A grant goes by the identifier and not by the path, because it is the
/// application that a person trusts: it stays granted when it is moved, and what takes its place at the path is not
/// granted anything. But whoever writes a manifest chooses the identifier; so a manifest that others than the superuser
/// and this process's user can write is not believed, nor such a grants file, and nor are the directories of both.
/// Any thread.
class PrivacyConsent final : public platform::PrivacyConsent {
public:
    explicit PrivacyConsent(const Root& root) : _directory(root.database()) {}

    /// Does nothing: each question reads the file anew.
    void flushBundleCaches(const BundleObject& bundle) override;
    /// Empty when nothing was decided for the application; none, with the reason in the log, when the manifest or the
    /// grants cannot be believed or read.
    std::optional<std::vector<ConsentRecord>> informationForBundle(const BundleObject& bundle) override;

private:
    const std::string _directory;
};

} // namespace platform::linux_
