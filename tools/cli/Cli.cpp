#include "tools/cli/Cli.h"

#include <algorithm>
#include <cstdio>

#include "platform/layout/Layout.h"

namespace corvane::cli {

std::optional<std::string> Parsed::value(const std::string& option) const {
    auto it = options.find(option);
    if (it == options.end() || it->second.empty()) return std::nullopt;
    return it->second.back();
}

int usageError(const std::string& tool, const std::string& message, const std::string& usage) {
    std::fprintf(stderr, "%s: %s\nusage: %s %s\n", tool.c_str(), message.c_str(), tool.c_str(), usage.c_str());
    return kUsage;
}

int fail(const std::string& tool, const std::string& message, int status) {
    std::fprintf(stderr, "%s: %s\n", tool.c_str(), message.c_str());
    return status;
}

Outcome parse(const std::string& tool, const Syntax& syntax, const std::vector<std::string>& args) {
    auto contains = [](const std::vector<std::string>& list, const std::string& word) {
        return std::find(list.begin(), list.end(), word) != list.end();
    };
    Parsed parsed;
    bool optionsEnded = false;
    for (size_t i = 0; i < args.size(); ++i) {
        const std::string& word = args[i];
        bool looksLikeOption = !optionsEnded && word.size() > 1 && word[0] == '-';
        if (!looksLikeOption) {
            parsed.operands.push_back(word);
            continue;
        }
        if (word == "--") {
            optionsEnded = true;
        } else if (word == "--help" || word == "-h") {
            std::printf("usage: %s %s\n", tool.c_str(), syntax.usage.c_str());
            return {std::nullopt, kSuccess};
        } else if (contains(syntax.flags, word)) {
            parsed.options[word].emplace_back();
        } else if (contains(syntax.valued, word)) {
            if (i + 1 >= args.size()) return {std::nullopt, usageError(tool, "option " + word + " needs a value", syntax.usage)};
            parsed.options[word].push_back(args[++i]);
        } else {
            return {std::nullopt, usageError(tool, "unknown option " + word, syntax.usage)};
        }
    }
    if (parsed.operands.size() < syntax.minOperands)
        return {std::nullopt, usageError(tool, "missing operand", syntax.usage)};
    if (parsed.operands.size() > syntax.maxOperands)
        return {std::nullopt, usageError(tool, "unexpected argument " + parsed.operands[syntax.maxOperands], syntax.usage)};
    return {std::move(parsed), kSuccess};
}

int checkPlaces(const std::string& tool, bool runtime) {
    Status places = layout::checkPlaces(runtime);
    return places.ok() ? kSuccess : fail(tool, places.error().description(), kConfig);
}

int runCommand(const std::string& tool, const char* help, const std::vector<Command>& commands,
               std::vector<std::string> args, bool runtime) {
    if (args.empty()) {
        std::fputs(help, stderr);
        return kUsage;
    }
    if (args[0] == "--help" || args[0] == "-h") {
        std::fputs(help, stdout);
        return kSuccess;
    }
    std::string name = args[0];
    args.erase(args.begin());
    for (const auto& command : commands) {
        if (name != command.name) continue;
        Outcome parsed = parse(tool, command.syntax, args);
        if (!parsed.parsed) return parsed.exitStatus;
        if (int status = checkPlaces(tool, runtime); status != kSuccess) return status;
        return command.run(*parsed.parsed);
    }
    std::fprintf(stderr, "%s: unknown command %s\n%s", tool.c_str(), name.c_str(), help);
    return kUsage;
}

}  // namespace corvane::cli
