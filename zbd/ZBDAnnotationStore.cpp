#include "zbd/ZBDAnnotationStore.h"

#include "Zembra/ZBLog.h"
#include "Zembra/ZBUtilities.h"
#include "platform/Format.h"
#include "platform/TracePoints.h"
#include "zbd/ZBDPlugIn.h"

namespace zbd {

namespace log = zembra::log;
using platform::Dictionary;
using platform::Error;
using platform::MutableDictionary;
using platform::URL;

namespace {

constexpr std::string_view versionKey = "version";
constexpr std::string_view dataKey = "data";
constexpr std::string_view damagedSuffix = ".damaged";

platform::Result<std::string> encodedDatabase(const Dictionary& annotations) {
    auto bytes =
        platform::encodeXML(Dictionary{{versionKey, ZBDAnnotationStore::databaseVersion}, {dataKey, annotations}});
    if (bytes && bytes->size() > ZBDAnnotationStore::maximumFileSize) {
        return Error{platform::fileErrorDomain, platform::fileWriteOutOfSpaceCode, "the annotations are too large"};
    }
    return bytes;
}

} // namespace

ZBDAnnotationStore::ZBDAnnotationStore(platform::Platform& platform, URL url)
    : _platform(platform), _annotationsURL(std::move(url)) {}

std::unique_ptr<ZBDAnnotationStore> ZBDAnnotationStore::initWithDatabase(platform::Platform& platform,
                                                                         const std::optional<std::string>& path) {
    std::unique_ptr<ZBDAnnotationStore> store(
        new ZBDAnnotationStore(platform, path ? URL::file(*path) : defaultDatabaseURL(platform)));
    Error error;
    if (store->loadDb(store->_annotationsURL, error)) return store;
    if (error.code != platform::fileReadNoSuchFileCode) {
        log::ops().error("unable to load annotation database:%{public}@ error:%{public}@ (resetting)",
                         store->_annotationsURL, error);
        store->_isFileDamaged = true;
    }
    if (store->loadDb(containerURL(platform), error)) {
        log::ops().info("migrating shared annotations");
        if (!store->saveDb(error)) {
            log::ops().error("unable to save migrated annotations to %{public}@ error:%{public}@",
                             store->_annotationsURL, error);
        }
    }
    return store;
}

std::optional<Dictionary> ZBDAnnotationStore::annotationForIdentifier(std::string_view annotationKey) const {
    return _annotations.dictionary(annotationKey);
}

std::optional<Dictionary> ZBDAnnotationStore::annotationForPlugIn(const ZBDPlugIn& plugIn) const {
    return annotationForIdentifier(plugIn.annotationKey());
}

void ZBDAnnotationStore::setAnnotation(const std::optional<Dictionary>& annotation, const ZBDPlugIn& plugIn) {
    // The change does not outlive this call, so it needs no share in the record.
    const AnnotationChange change{annotation, {std::shared_ptr<void>(), &plugIn}};
    setAnnotations({&change, 1});
}

void ZBDAnnotationStore::setAnnotations(std::span<const AnnotationChange> changes) {
    const auto before = MutableDictionary::copyOf(_annotations);
    for (const AnnotationChange& change : changes) {
        if (const auto failure = apply(change)) {
            log::ops().error("unable to save annotations:%{public}@ error:%{public}@", _annotationsURL, *failure);
        }
    }
    ++_version; // also where it goes back: nobody reads meanwhile
    const auto bytes = encodedDatabase(_annotations);
    if (!bytes) {
        // Each was tried alone, so they are too large together; or the file had in it what no file of ours can hold.
        if (bytes.error().code == platform::fileWriteOutOfSpaceCode) _annotations = before;
        log::ops().error("unable to save annotations:%{public}@ error:%{public}@", _annotationsURL, bytes.error());
        return;
    }
    Error error;
    if (!write(*bytes, error)) {
        log::ops().error("unable to save annotations:%{public}@ error:%{public}@", _annotationsURL, error);
    }
}

platform::Failure ZBDAnnotationStore::apply(const AnnotationChange& change) {
    const std::string key = change.plugIn->annotationKey();
    if (!change.annotation) {
        _annotations.remove(key);
        return std::nullopt;
    }
    // As it will stand in the file. Tried alone, so that it is the only one refused.
    const auto encoded = encodedDatabase(Dictionary{{key, *change.annotation}});
    if (!encoded) return encoded.error();
    // A new dictionary each time: requests may still be reading the stored one.
    auto merged = MutableDictionary::copyOf(annotationForIdentifier(key).value_or(Dictionary()));
    merged.merge(*change.annotation);
    _annotations.set(key, merged);
    return std::nullopt;
}

bool ZBDAnnotationStore::loadDb(const URL& url, Error& error) {
    const auto load = [&]() -> platform::Failure {
        auto bytes = _platform.files.read(url.path(), maximumFileSize);
        if (!bytes) return bytes.error();
        auto content = platform::decodePropertyList(*bytes);
        if (!content) return content.error();
        const Dictionary database = content->dictionary().value_or(Dictionary());
        const auto version = database[versionKey].integerValue().value_or(0);
        if (version != databaseVersion) {
            return zembra::errorWithCode(
                zembra::code::version,
                platform::format("found database version %d needed version %d", version, databaseVersion));
        }
        _annotations = MutableDictionary::copyOf(database.dictionary(dataKey).value_or(Dictionary()));
        ++_version;
        return std::nullopt;
    };
    auto failure = load();
    if (!failure) return true;
    error = std::move(*failure);
    platform::trace::dbLoad(error.domain.c_str(), static_cast<std::uint64_t>(error.code));
    return false;
}

bool ZBDAnnotationStore::saveDb(Error& error) {
    const auto bytes = encodedDatabase(_annotations);
    if (bytes) return write(*bytes, error);
    error = bytes.error();
    return false;
}

bool ZBDAnnotationStore::write(const std::string& bytes, Error& error) {
    platform::Failure failure;
    if (_isFileDamaged) {
        failure = _platform.files.setAside(_annotationsURL.path(), damagedSuffix);
        if (failure && failure->code == platform::fileReadNoSuchFileCode) failure.reset();
        _isFileDamaged = failure.has_value();
    }
    if (!failure) failure = _platform.files.writeAtomically(_annotationsURL.path(), bytes);
    if (!failure) return true;
    error = std::move(*failure);
    return false;
}

URL ZBDAnnotationStore::defaultDatabaseURL(platform::Platform& platform) { return globalURL(platform); }

URL ZBDAnnotationStore::globalURL(platform::Platform& platform) {
    return URL::file(platform.files.locate("/var/db/Zembra-Annotations"));
}

URL ZBDAnnotationStore::containerURL(platform::Platform& platform) {
    const auto path = platform.containers.userContainer("com.nordane.zbd");
    if (path) return URL::file(*path);
    const auto number = static_cast<std::uint64_t>(path.error().code);
    log::ops().error("failed to get storage container: error=%llu", number);
    zembra::fatalInternalError(platform::format("unable to locate user container: error %llu", number));
}

} // namespace zbd
