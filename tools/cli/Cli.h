// The command-line convention every tool of the project follows (docs/tools.md): subcommands,
// `--help` on each, options spelled out and checked, and exit statuses from sysexits.h.
//
// A tool describes each subcommand with a Syntax and a function, and runCommand() parses the words
// after the subcommand and calls it, or answers the exit status when the tool is to stop (0 after
// printing the help, 64 after printing a usage error).
#pragma once

#include <cstddef>
#include <functional>
#include <map>
#include <optional>
#include <string>
#include <vector>

namespace corvane::cli {

// Exit statuses (sysexits.h).
enum ExitStatus : int {
    kSuccess = 0,
    kFailure = 1,        // anything not listed below
    kUsage = 64,         // a bad command line
    kDataError = 65,     // input that cannot be read or used
    kNoInput = 66,       // a named input file that does not exist
    kUnavailable = 69,   // a service that cannot be reached
    kCannotCreate = 73,  // an output file that cannot be made
    kNoPermission = 77,  // refused for lack of an entitlement or of permission
    kConfig = 78,        // the platform's places cannot be used (CORVANE_ROOT, XDG_RUNTIME_DIR)
};

struct Syntax {
    std::string usage;                  // "keygen --out KEY [--force]", after the tool's name
    std::vector<std::string> flags;     // options without a value ("--json")
    std::vector<std::string> valued;    // options that take one value ("--out"); may repeat
    size_t minOperands = 0;
    size_t maxOperands = static_cast<size_t>(-1);
};

struct Parsed {
    std::map<std::string, std::vector<std::string>> options;  // flags hold one empty value per use
    std::vector<std::string> operands;

    bool has(const std::string& option) const { return options.count(option) > 0; }
    // The last value given for the option.
    std::optional<std::string> value(const std::string& option) const;
};

// Parses `args` (the words after the subcommand). "--" ends the options; "-" alone is an operand.
// Unknown options, missing values and a wrong number of operands are usage errors.
struct Outcome {
    std::optional<Parsed> parsed;
    int exitStatus = kSuccess;  // when `parsed` is empty
};
Outcome parse(const std::string& tool, const Syntax& syntax, const std::vector<std::string>& args);

struct Command {
    const char* name;
    Syntax syntax;
    std::function<int(const Parsed&)> run;
};

// Runs the command that args[0] names with the rest of `args`. Without a command, or with an unknown
// one, prints `help` on standard error and returns kUsage; for --help prints it on standard output.
// Before a command runs, the platform's places are checked (checkPlaces; the runtime directory only
// for a tool that talks to the daemons, `runtime`).
int runCommand(const std::string& tool, const char* help, const std::vector<Command>& commands,
               std::vector<std::string> args, bool runtime = true);
// Prints why the platform's places cannot be used and returns kConfig, or returns kSuccess.
int checkPlaces(const std::string& tool, bool runtime = true);

// Prints "<tool>: <message>" and the usage line(s) on standard error; returns kUsage.
int usageError(const std::string& tool, const std::string& message, const std::string& usage);
// Prints "<tool>: <message>" on standard error; returns `status`.
int fail(const std::string& tool, const std::string& message, int status = kFailure);

}  // namespace corvane::cli
