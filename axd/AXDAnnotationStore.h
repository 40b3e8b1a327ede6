// The user's annotations of plug-ins, kept across restarts of the daemon.
//
// The whole table (annotation key -> annotation dictionary) lives in memory; the file is read once,
// at construction, and rewritten whole and atomically after every change. The file is an XML
// property list {"version": 16, "data": {key: annotation, ...}} that any property-list reader
// opens. Where it lives: the -d path when the daemon got one, else
// <data container 10 "com.corvane.axd">/com.corvane.annexa/Annotations; a file of earlier
// releases, <root>/var/db/Annexa-Annotations, is migrated when the primary file cannot be loaded.
// A file that exists but cannot be loaded is moved aside as <file>.damaged-<seconds since 1970>
// before the table starts empty. Every file operation goes through corvane::plist::fileSystem().
#pragma once

#include <atomic>
#include <memory>
#include <optional>
#include <string>

#include "Annexa/AXUtilities.h"

namespace annexa {

// Lives on: the database queue. The store has no lock of its own; the database serialises every
// use of it.
class AXDAnnotationStore {
public:
    static constexpr int64_t kVersion = 16;
    static constexpr int kContainerClass = 10;
    static constexpr const char* kContainerIdentifier = "com.corvane.axd";
    static constexpr const char* kEarlierReleasesFile = "/var/db/Annexa-Annotations";

    // Locates and loads the table (resetting or migrating as needed). `path` is the -d argument,
    // passed unchanged, or null for the default location. Ends the process only when the default
    // location's container or directory cannot be had.
    explicit AXDAnnotationStore(const char* path);

    const std::string& annotationsURL() const { return annotationsURL_; }
    const Dictionary& annotations() const { return annotations_; }

    // The stored annotation dictionary for an annotation key, or null.
    Value annotationForIdentifier(const std::string& key) const;
    // Merges the entries of `annotation` into the key's annotation (each entry replaces the entry
    // of the same key whole), or removes the key's annotation when `annotation` is null; then saves
    // (see saveIfChanged).
    Status setAnnotationForIdentifier(const Value& annotation, const std::string& key);
    // The same change, in memory only: a request makes all its changes so and saves once, with
    // saveIfChanged().
    void changeAnnotationForIdentifier(const Value& annotation, const std::string& key);
    // Saves when anything changed since the last save. A failed save is logged and undoes every
    // change since the last save that succeeded: the table in memory is always the one on disk,
    // so nothing is kept that was not acknowledged.
    Status saveIfChanged();

    // Plug-in forms of the two operations: the key is the plug-in's annotationKey().
    template <class PlugIn>
    Value annotationForPlugIn(const PlugIn& plugIn) const {
        return annotationForIdentifier(plugIn.annotationKey());
    }
    template <class PlugIn>
    Status setAnnotationForPlugIn(const Value& annotation, const PlugIn& plugIn) {
        return setAnnotationForIdentifier(annotation, plugIn.annotationKey());
    }
    template <class PlugIn>
    void changeAnnotationForPlugIn(const Value& annotation, const PlugIn& plugIn) {
        changeAnnotationForIdentifier(annotation, plugIn.annotationKey());
    }

    // Reads the file at `path` and installs its table; the table is unchanged on failure.
    Status loadDb(const std::string& path);
    // Writes the whole table to annotationsURL().
    Status saveDb();

    // Changes whenever any store's table changes, in memory (not when it is saved).
    static uint64_t changeCount() { return changes_.load(); }

    // The default file location, creating its directory (fatal when that fails).
    static std::string defaultDatabaseURL();
    // The daemon's data container directory (fatal when there is none).
    static std::string containerURL();

private:
    // Something changed that the next save writes; the table as saved is kept until then.
    void markChanged();

    std::string annotationsURL_;
    Dictionary annotations_;
    Dictionary saved_;      // the table as the file holds it, while changes wait for a save
    bool changed_ = false;  // since the last save
    static inline std::atomic<uint64_t> changes_{0};
};

}  // namespace annexa
