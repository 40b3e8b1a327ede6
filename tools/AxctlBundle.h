// axctl bundle new / check: a bundle skeleton to start from, and everything the platform would say
// about a bundle before it is registered.
#pragma once

#include <string>

#include "tools/cli/Cli.h"

namespace axctl {

extern const corvane::cli::Syntax kBundle;
int bundle(const std::string& service, const corvane::cli::Parsed& p);

}  // namespace axctl
