#include "tools/cli/Cli.h"

#include <algorithm>
#include <cstdio>

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

Outcome parse(const std::string& tool, const Spec& spec, const std::vector<std::string>& args) {
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
            std::printf("usage: %s %s\n", tool.c_str(), spec.usage.c_str());
            return {std::nullopt, kSuccess};
        } else if (contains(spec.flags, word)) {
            parsed.options[word].emplace_back();
        } else if (contains(spec.valued, word)) {
            if (i + 1 >= args.size()) return {std::nullopt, usageError(tool, "option " + word + " needs a value", spec.usage)};
            parsed.options[word].push_back(args[++i]);
        } else {
            return {std::nullopt, usageError(tool, "unknown option " + word, spec.usage)};
        }
    }
    if (parsed.operands.size() < spec.minOperands)
        return {std::nullopt, usageError(tool, "missing operand", spec.usage)};
    if (parsed.operands.size() > spec.maxOperands)
        return {std::nullopt, usageError(tool, "unexpected argument " + parsed.operands[spec.maxOperands], spec.usage)};
    return {std::move(parsed), kSuccess};
}

}  // namespace corvane::cli
