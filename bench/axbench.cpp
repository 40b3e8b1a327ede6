#include <cstdio>
#include <cstring>
#include <map>
#include <string>

#include "bench/Bench.h"

namespace axbench {

namespace {

struct Entry {
    const char* help;
    Run run;
};

std::map<std::string, Entry>& table() {
    static std::map<std::string, Entry> t;
    return t;
}

}  // namespace

bool registerSubcommand(const char* name, const char* help, Run run) {
    table().emplace(name, Entry{help, run});
    return true;
}

}  // namespace axbench

int main(int argc, char** argv) {
    auto& table = axbench::table();
    if (argc < 2 || std::strcmp(argv[1], "--help") == 0 || !table.count(argv[1])) {
        std::fprintf(argc < 2 || std::strcmp(argv[1], "--help") == 0 ? stdout : stderr,
                     "usage: axbench SUBCOMMAND [options]\n\nsubcommands:\n");
        for (auto& [name, e] : table) std::fprintf(stderr, "  %-10s %s\n", name.c_str(), e.help);
        return argc < 2 || std::strcmp(argv[1], "--help") == 0 ? 0 : 64;
    }
    return table.at(argv[1]).run(argc - 1, argv + 1);
}
