// Property lists and whole-file atomic replacement.
//
// Reading accepts the XML and the binary forms; writing produces the XML form, format version 1.0.
// Integers read back as signed 64-bit values, and as unsigned ones past the signed range; writing
// keeps both exact. Dates are written to the whole second, as the XML form carries them. Readers
// refuse strings and keys holding NUL bytes or invalid UTF-8, nesting deeper than 512 levels,
// cycles and oversized expansions of shared objects, with an error value.
//
// The readers and the writer are our own, not libplist's: libplist 2.2 aborts the process on
// strings and keys that hold a NUL byte and has no signed integers. plistutil (libplist-utils)
// serves the tests as an independent reader.
//
// Values with no property-list form (null, UUID, file descriptor, strings with characters XML
// cannot carry) make writing fail with an error of the domain kPlistErrorDomain; nothing is
// written then.
//
// Thread-safety: every function here is safe to call from any thread.
#pragma once

#include <sys/types.h>

#include <string>
#include <string_view>

#include "platform/value/Value.h"

namespace corvane::plist {

inline constexpr const char* kPlistErrorDomain = "com.corvane.plist";
inline constexpr int64_t kPlistReadCorrupt = 3840;
inline constexpr int64_t kPlistWriteInvalid = 3851;

// Parses bytes in either form.
Result<Value> parse(std::string_view bytes);
// Reads a whole file and parses it. A missing file is Error::file's kFileNoSuchFile.
Result<Value> readFile(const std::string& path);

// The XML form of a value.
Result<std::string> toXML(const Value& value);

// The file operations of the atomic writer and of the stores that keep their files with it (the
// annotation store reads, writes and moves its file through them), in one small interface: a test
// replaces it to make any step fail the way a full, failing or read-only disk would (ENOSPC, EIO,
// EROFS, an fsync that fails). Each operation answers 0 or the errno of its failure.
// Thread-safety: the real one is safe from any thread; setFileSystem is for tests, before the
// operations it should affect.
class FileSystem {
public:
    virtual ~FileSystem() = default;
    virtual int openFile(const std::string& path, int flags, mode_t mode, int& fd);
    virtual int writeSome(int fd, const char* data, size_t size, size_t& written);
    virtual int readSome(int fd, char* data, size_t size, size_t& got);
    virtual int syncFile(int fd);
    virtual int closeFile(int fd);
    // Gives the open unnamed file `fd` the name `path`.
    virtual int linkOpenFile(int fd, const std::string& path);
    virtual int linkFile(const std::string& from, const std::string& to);
    virtual int renameFile(const std::string& from, const std::string& to);
    virtual int removeFile(const std::string& path);
    virtual int syncDirectory(const std::string& path);
};
// The file system the functions below use: the real one unless a test set another.
FileSystem& fileSystem();
// Null restores the real one. Not owned.
void setFileSystem(FileSystem* replacement);

// Reads a whole file.
Result<std::string> readWholeFile(const std::string& path);

// Replaces the file at `path` with `bytes` so that a reader sees the old contents or the new, never
// a mix, also across a crash: an unnamed file in the target's directory is written in full,
// fsynced, linked in as ".<name>.<pid>-<n>.new" and at once renamed over the target, and the
// directory is fsynced. A failure at any step, the directory's fsync included, leaves the old file as
// it was (the old file is kept under ".<name>.<pid>-<n>.old" until the directory is synced, and put back when
// that fails) and no temporary file behind; a process killed meanwhile leaves at most those names,
// which removeStaleTemporaries clears. The new file gets `mode` (masked by the umask).
//
// Unsynced skips both fsyncs: readers still see the old contents or the new whole, and after a
// crash the file holds one of them (a file renamed over another is written before the rename), but
// possibly the old one. For files that only repeat what a durable store holds.
enum class Durability { Synced, Unsynced };
Status writeFileAtomically(const std::string& path, std::string_view bytes, mode_t mode = 0666,
                           Durability durability = Durability::Synced);

// Removes what writes to `path` killed half-way may have left beside it (".<name>.*"); for the one
// writer of a file, at its start.
void removeStaleTemporaries(const std::string& path);

// toXML, then writeFileAtomically.
Status writeXMLFile(const std::string& path, const Value& value, mode_t mode = 0666);

}  // namespace corvane::plist
