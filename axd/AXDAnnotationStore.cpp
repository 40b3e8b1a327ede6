#include "axd/AXDAnnotationStore.h"

#include <cinttypes>
#include <cstdio>
#include <cstdlib>

#include "platform/containers/Containers.h"
#include "platform/layout/Layout.h"
#include "platform/plist/Plist.h"
#include "platform/trace/Trace.h"

namespace annexa {

namespace log = corvane::log;

namespace {

[[noreturn]] void fatal(const std::string& text) {
    std::fprintf(stderr, "axd: fatal: %s\n", text.c_str());
    std::fflush(stderr);
    std::abort();
}

// "version" as an integer: a number, or a text holding a decimal integer; anything else is 0.
int64_t versionOf(const Value& top) {
    const Value& v = top["version"];
    if (v.isNumber()) return *v.int64Value();
    if (const std::string* s = v.asString()) {
        char* end = nullptr;
        long long n = std::strtoll(s->c_str(), &end, 10);
        if (!s->empty() && end && *end == '\0') return n;
    }
    return 0;
}

}  // namespace

AXDAnnotationStore::AXDAnnotationStore(const char* path)
    : annotationsURL_(path ? std::string(path) : defaultDatabaseURL()) {
    Error error;
    if (loadDb(annotationsURL_, &error)) return;
    if (!(error.domain == corvane::kFileErrorDomain && error.code == corvane::kFileNoSuchFile)) {
        log::error(logOps(), "unable to load annotation database:%{public}@ error:%{public}@ (resetting)",
                   annotationsURL_, error);
    }
    Error oldError;
    if (loadDb(corvane::layout::underRoot(kEarlierReleasesFile), &oldError)) {
        log::info(logOps(), "migrating old annotations");
        Error saveError;
        if (!saveDb(&saveError)) {
            log::error(logOps(), "unable to save migrated annotations to %{public}@ error:%{public}@",
                       annotationsURL_, saveError);
        }
        return;
    }
    annotations_.clear();
}

Value AXDAnnotationStore::annotationForIdentifier(const std::string& key) const {
    auto it = annotations_.find(key);
    return it == annotations_.end() ? Value() : it->second;
}

void AXDAnnotationStore::setAnnotationForIdentifier(const Value& annotation, const std::string& key) {
    if (annotation.isNull()) {
        annotations_.erase(key);
    } else {
        const Dictionary* current = annotations_.count(key) ? annotations_[key].asDictionary() : nullptr;
        Dictionary merged = current ? *current : Dictionary{};
        if (const Dictionary* changes = annotation.asDictionary()) {
            for (const auto& [k, v] : *changes) merged.insert_or_assign(k, v);
        }
        annotations_.insert_or_assign(key, Value(std::move(merged)));
    }
    Error error;
    if (!saveDb(&error)) {
        log::error(logOps(), "unable to save annotations:%{public}@ error:%{public}@", annotationsURL_,
                   error);
    }
}

bool AXDAnnotationStore::loadDb(const std::string& path, Error* error) {
    auto fail = [&](Error e) {
        AXD_TRACE(db__load, e.domain.c_str(), static_cast<uint64_t>(e.code));
        if (error) *error = std::move(e);
        return false;
    };
    auto top = corvane::plist::readFile(path);
    if (!top) return fail(top.error());
    int64_t version = versionOf(*top);
    if (version != kVersion) {
        return fail(makeErrorWithFormat(7, "found database version %d needed version %d", version,
                                        kVersion));
    }
    // A current file whose "data" is missing or of another type still gives a usable table.
    const Dictionary* data = (*top)["data"].asDictionary();
    annotations_ = data ? *data : Dictionary{};
    return true;
}

bool AXDAnnotationStore::saveDb(Error* error) {
    Value top = corvane::dict({{"version", kVersion}, {"data", Value(annotations_)}});
    if (auto err = corvane::plist::writeXMLFile(annotationsURL_, top)) {
        if (error) *error = std::move(*err);
        return false;
    }
    return true;
}

std::string AXDAnnotationStore::defaultDatabaseURL() {
    std::string dir = containerURL() + "/com.corvane.annexa/";
    if (auto err = corvane::layout::makeDirectories(dir.substr(0, dir.size() - 1), 0700)) {
        log::error(logOps(), "failed to create storage directory at %{public}@ - error=%{public}@",
                   dir, *err);
        fatal(log::formatText("unable to create plugin annotations directory:%@ error:%@", dir, *err));
    }
    std::string file = dir + "Annotations";
    log::debug(logOps(), "annotations are stored at %{public}@", file);
    return file;
}

std::string AXDAnnotationStore::containerURL() {
    auto container =
        corvane::containers::lookupDataContainer(kContainerClass, kContainerIdentifier, true);
    if (!container) {
        auto code = static_cast<unsigned long long>(container.error().code);
        log::error(logOps(), "failed to get storage container: error=%llu", code);
        fatal(log::formatText("unable to locate user container: error %llu", code));
    }
    return *container;
}

}  // namespace annexa
