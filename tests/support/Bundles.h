// Bundles laid out on disk for tests.
#pragma once

#include <string>

#include "platform/value/Value.h"

namespace axtest {

// Makes <parent>/<name> with Info.plist (XML) from `info`; when `executableSource` names a file, it
// is copied in as the bundle's executable (named by info's "KFBundleExecutable"), mode 0755.
// Returns the bundle's path.
std::string makeBundle(const std::string& parent, const std::string& name, const corvane::Value& info,
                       const std::string& executableSource = "");

// An application bundle's Info.plist.
corvane::Value appInfo(const std::string& identifier, const std::string& executable = "app");
// A plug-in bundle's Info.plist with the given plug-in dictionary.
corvane::Value plugInInfo(const std::string& identifier, const corvane::Value& plugin,
                          const std::string& executable = "plugin");

}  // namespace axtest
