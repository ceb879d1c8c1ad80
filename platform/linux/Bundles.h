#pragma once

#include "platform/Bundles.h"
#include "platform/Files.h"

namespace platform::linux_ {

/// Bundles read through `Files`. Callable from any thread; the objects it gives out live on without it, but not without
/// the files.
class Bundles final : public platform::Bundles {
public:
    explicit Bundles(platform::Files& files) : _files(files) {}

    /// The bundle of the running program, else the program itself looked at as a bundle directory.
    std::shared_ptr<const BundleObject> main() override;
    /// In directory mode the path property is `path` as given, also when nothing is there. In executable mode it is the
    /// canonical path of the bundle.
    std::shared_ptr<const BundleObject> fromPath(const std::string& path, BundleMode mode) override;

private:
    platform::Files& _files;
};

} // namespace platform::linux_
