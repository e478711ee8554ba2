// zeparelayctl: control of the relay daemon from the command line.
#include <cstdio>
#include <cstring>
#include <string>

#include <zepasdk/sysroot.h>

#include "commands.h"

using zeparelayctl::Args;
using zeparelayctl::Command;
using zeparelayctl::kCommands;

namespace {

void Usage(FILE* out) {
    fputs(
        "Usage: zeparelayctl [--root DIR] COMMAND [ARGS]\n"
        "Controls the relay daemon zeparelayd.\n"
        "\n"
        "  --root DIR     system root: every fixed path is taken below DIR\n"
        "  -h, --help     this text; COMMAND --help explains one command\n"
        "  -V, --version  print the version\n"
        "\n"
        "Commands:\n",
        out);
    for (const Command* c = kCommands; c->name != nullptr; ++c) fprintf(out, "  %s\n", c->synopsis);
    fputs(
        "\n"
        "Exit status: 0 done, 1 the daemon does not run, 2 broken status file,\n"
        "5 configuration not readable or writable, 6 no server id / service not\n"
        "relayed, 11 busy, 64 bad usage, 255 broken status or debug file.\n",
        out);
}

const Command* Find(const std::string& name) {
    for (const Command* c = kCommands; c->name != nullptr; ++c) {
        if (name == c->name) return c;
    }
    return nullptr;
}

}  // namespace

int main(int argc, char** argv) {
    int i = 1;
    for (; i < argc && argv[i][0] == '-'; ++i) {
        const std::string arg = argv[i];
        if (arg == "-h" || arg == "--help") {
            Usage(stdout);
            return zeparelayctl::EXIT_OK;
        }
        if (arg == "-V" || arg == "--version") {
            printf("zeparelayctl %s\n", ZEPARELAYD_VERSION);
            return zeparelayctl::EXIT_OK;
        }
        if (arg == "--root" && i + 1 < argc) {
            if (ZEPASysRootSet(argv[++i]) != 0) {
                fprintf(stderr, "zeparelayctl: the root must be an absolute path: %s\n", argv[i]);
                return zeparelayctl::EXIT_USAGE;
            }
            continue;
        }
        fprintf(stderr, "zeparelayctl: unknown or incomplete option '%s'\n", arg.c_str());
        Usage(stderr);
        return zeparelayctl::EXIT_USAGE;
    }
    if (i >= argc) {
        Usage(stderr);
        return zeparelayctl::EXIT_USAGE;
    }
    const Command* cmd = Find(argv[i]);
    if (cmd == nullptr) {
        fprintf(stderr, "zeparelayctl: unknown command '%s'\n", argv[i]);
        Usage(stderr);
        return zeparelayctl::EXIT_USAGE;
    }
    Args args(argv + i + 1, argv + argc);
    if (args.size() == 1 && (args[0] == "--help" || args[0] == "-h")) {
        printf("Usage: zeparelayctl [--root DIR] %s\n\n%s", cmd->synopsis, cmd->help);
        return zeparelayctl::EXIT_OK;
    }
    const int ret = cmd->run(args);
    if (ret == zeparelayctl::EXIT_USAGE) {
        fprintf(stderr, "zeparelayctl: usage: zeparelayctl %s\n", cmd->synopsis);
    }
    return ret;
}
