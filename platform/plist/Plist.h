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

// Reads a whole file.
Result<std::string> readWholeFile(const std::string& path);

// Replaces the file at `path` with `bytes` so that a reader sees the old contents or the new, never
// a mix, also across a crash: an unnamed file in the target's directory is written in full,
// fsynced, linked in as ".<name>.<pid>.new" and at once renamed over the target, and the directory
// is fsynced. A failure leaves the old file as it was and no temporary file behind; a process killed
// meanwhile leaves at most the linked name, for the instant between link and rename. The new file
// gets `mode` (masked by the umask).
Status writeFileAtomically(const std::string& path, std::string_view bytes, mode_t mode = 0666);

// Removes what writes to `path` killed half-way may have left beside it (".<name>.*"); for the one
// writer of a file, at its start.
void removeStaleTemporaries(const std::string& path);

// toXML, then writeFileAtomically.
Status writeXMLFile(const std::string& path, const Value& value, mode_t mode = 0666);

}  // namespace corvane::plist
