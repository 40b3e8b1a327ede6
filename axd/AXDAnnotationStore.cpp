#include "axd/AXDAnnotationStore.h"

#include <cinttypes>
#include <cstdio>
#include <cstdlib>
#include <cstring>

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
    // The daemon is the file's one writer: whatever a write killed half-way left is stale.
    corvane::plist::removeStaleTemporaries(annotationsURL_);
    Status loaded = loadDb(annotationsURL_);
    if (loaded.ok()) return;
    const Error& error = loaded.error();
    if (!(error.domain == corvane::kFileErrorDomain && error.code == corvane::kFileNoSuchFile)) {
        // The user's choices in a file we cannot read are not ours to destroy: the file is kept
        // beside, for whoever can mend it, before the first save writes a new one.
        std::string aside = annotationsURL_ + ".damaged-" + std::to_string(corvane::Date::now().wholeSeconds());
        if (int err = corvane::plist::fileSystem().renameFile(annotationsURL_, aside)) {
            log::error(logOps(),
                       "unable to load annotation database:%{public}@ error:%{public}@ (resetting; it could not be "
                       "kept aside: %{public}s)",
                       annotationsURL_, error, std::strerror(err));
        } else {
            log::error(logOps(),
                       "unable to load annotation database:%{public}@ error:%{public}@ (resetting; the damaged file "
                       "is kept as %{public}@)",
                       annotationsURL_, error, aside);
        }
    }
    if (loadDb(corvane::layout::underRoot(kEarlierReleasesFile)).ok()) {
        log::info(logOps(), "migrating old annotations");
        if (Status saved = saveDb(); !saved.ok()) {
            log::error(logOps(), "unable to save migrated annotations to %{public}@ error:%{public}@",
                       annotationsURL_, saved.error());
            markChanged();  // the next save tries again
        }
        return;
    }
    annotations_.clear();
    ++changes_;
}

Value AXDAnnotationStore::annotationForIdentifier(const std::string& key) const {
    auto it = annotations_.find(key);
    return it == annotations_.end() ? Value() : it->second;
}

Status AXDAnnotationStore::setAnnotationForIdentifier(const Value& annotation, const std::string& key) {
    changeAnnotationForIdentifier(annotation, key);
    return saveIfChanged();
}

void AXDAnnotationStore::changeAnnotationForIdentifier(const Value& annotation, const std::string& key) {
    auto it = annotations_.find(key);
    if (annotation.isNull()) {
        if (it == annotations_.end()) return;
        if (!changed_) saved_ = annotations_;
        annotations_.erase(it);
        changed_ = true;
        ++changes_;
        return;
    }
    const Dictionary* current = it != annotations_.end() ? it->second.asDictionary() : nullptr;
    Dictionary merged = current ? *current : Dictionary{};
    if (const Dictionary* changes = annotation.asDictionary()) {
        for (const auto& [k, v] : *changes) merged.insert_or_assign(k, v);
    }
    // Setting what is already stored changes nothing, and costs no write of the file.
    if (current && merged == *current) return;
    if (!changed_) saved_ = annotations_;
    annotations_.insert_or_assign(key, Value(std::move(merged)));
    changed_ = true;
    ++changes_;
}

void AXDAnnotationStore::markChanged() {
    if (!changed_) saved_ = annotations_;
    changed_ = true;
    ++changes_;
}

Status AXDAnnotationStore::saveIfChanged() {
    if (!changed_) return {};
    changed_ = false;
    Status saved = saveDb();
    if (!saved.ok()) {
        log::error(logOps(), "unable to save annotations:%{public}@ error:%{public}@", annotationsURL_,
                   saved.error());
        // What is not on disk is not kept: the table goes back to what the file holds.
        annotations_ = std::move(saved_);
        ++changes_;
    }
    saved_.clear();
    return saved;
}

Status AXDAnnotationStore::loadDb(const std::string& path) {
    auto fail = [](Error e) {
        AXD_TRACE(db__load, e.domain.c_str(), static_cast<uint64_t>(e.code));
        return Status(std::move(e));
    };
    auto top = corvane::plist::readFile(path);
    if (!top) return fail(top.error());
    int64_t version = versionOf(*top);
    if (version != kVersion) {
        return fail(makeErrorWithFormat(AXErrorCode::VersionMismatch, "found database version %d needed version %d", version,
                                        kVersion));
    }
    // A current file whose "data" is missing or of another type still gives a usable table.
    const Dictionary* data = (*top)["data"].asDictionary();
    annotations_ = data ? *data : Dictionary{};
    ++changes_;
    return {};
}

Status AXDAnnotationStore::saveDb() {
    return corvane::plist::writeXMLFile(annotationsURL_, corvane::dict({{"version", kVersion}, {"data", Value(annotations_)}}));
}

std::string AXDAnnotationStore::defaultDatabaseURL() {
    std::string dir = containerURL() + "/com.corvane.annexa/";
    if (Status made = corvane::layout::makeDirectories(dir.substr(0, dir.size() - 1), 0700); !made.ok()) {
        log::error(logOps(), "failed to create storage directory at %{public}@ - error=%{public}@",
                   dir, made.error());
        fatal(log::formatText("unable to create plugin annotations directory:%@ error:%@", dir, made.error()));
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
