// zeparelayctl: control of the relay daemon from the command line.
#include <getopt.h>

#include <cstdio>
#include <cstdlib>
#include <cstring>
#include <string>

#include <zeparelayd/daemon.h>
#include <zepasdk/sysroot.h>

#include "commands.h"

using zeparelayctl::Args;
using zeparelayctl::Command;
using zeparelayctl::kCommands;
using namespace zepatools;

namespace {

void Usage(FILE* out) {
    fputs(
        "Usage: zeparelayctl [OPTIONS] COMMAND [ARGS]   (options may come anywhere)\n"
        "Controls the relay daemon zeparelayd.\n"
        "\n"
        "  --root DIR     system root: every fixed path is taken below DIR\n"
        "  -q, --quiet    print nothing on standard output; only the exit status tells\n"
        "  -v, --verbose  also show the library's own log lines (on standard error)\n"
        "  -h, --help     this text; COMMAND --help explains one command\n"
        "  -V, --version  print the version\n"
        "\n"
        "Commands:\n",
        out);
    for (const Command* c = kCommands; c->name != nullptr; ++c) fprintf(out, "  %s\n", c->synopsis);
    fputs("\n", out);
    fputs(kExitTable, out);
}

const Command* Find(const std::string& name) {
    for (const Command* c = kCommands; c->name != nullptr; ++c) {
        if (name == c->name) return c;
    }
    return nullptr;
}

}  // namespace

int main(int argc, char** argv) {
    enum { OPT_ROOT = 256, OPT_JSON, OPT_DEBUG, OPT_TIMEOUT };
    const option longOptions[] = {
        {"root", required_argument, nullptr, OPT_ROOT},
        {"quiet", no_argument, nullptr, 'q'},
        {"verbose", no_argument, nullptr, 'v'},
        {"help", no_argument, nullptr, 'h'},
        {"version", no_argument, nullptr, 'V'},
        {"json", no_argument, nullptr, OPT_JSON},
        {"debug", no_argument, nullptr, OPT_DEBUG},
        {"timeout", required_argument, nullptr, OPT_TIMEOUT},
        {nullptr, 0, nullptr, 0},
    };
    zeparelayctl::Options opt;
    bool help = false;
    bool quiet = false;
    bool verbose = false;
    int c;
    while ((c = getopt_long(argc, argv, "qvhV", longOptions, nullptr)) != -1) {
        switch (c) {
            case OPT_ROOT:
                if (ZEPASysRootSet(optarg) != 0) {
                    fprintf(stderr, "zeparelayctl: --root %s: the root must be an absolute path\n", optarg);
                    return EXIT_USAGE;
                }
                break;
            case 'q':
                quiet = true;
                break;
            case 'v':
                verbose = true;
                break;
            case 'h':
                help = true;
                break;
            case 'V':
                printf("zeparelayctl %s\n", ZEPARELAYD_VERSION);
                return EXIT_OK;
            case OPT_JSON:
                opt.json = true;
                break;
            case OPT_DEBUG:
                opt.debug = true;
                break;
            case OPT_TIMEOUT: {
                char* end = nullptr;
                const double seconds = strtod(optarg, &end);
                if (end == optarg || *end != '\0' || !(seconds >= 0.1 && seconds <= 60)) {
                    fprintf(stderr, "zeparelayctl: --timeout %s: give seconds between 0.1 and 60\n", optarg);
                    return EXIT_USAGE;
                }
                opt.timeoutMs = static_cast<int>(seconds * 1000);
                break;
            }
            default:  // getopt has named the option
                fputs("Try 'zeparelayctl --help'.\n", stderr);
                return EXIT_USAGE;
        }
    }
    if (optind >= argc) {
        if (help) {
            Usage(stdout);
            return EXIT_OK;
        }
        Usage(stderr);
        return EXIT_USAGE;
    }
    const Command* cmd = Find(argv[optind]);
    if (cmd == nullptr) {
        fprintf(stderr, "zeparelayctl: unknown command '%s'\n", argv[optind]);
        Usage(stderr);
        return EXIT_USAGE;
    }
    if (help) {
        printf("Usage: zeparelayctl [--root DIR] %s\n\n%s", cmd->synopsis, cmd->help);
        return EXIT_OK;
    }
    if (opt.debug && strcmp(cmd->name, "status") != 0) {
        fprintf(stderr, "zeparelayctl: --debug belongs to \"status\"\n");
        return EXIT_USAGE;
    }
    if (opt.json && strcmp(cmd->name, "status") != 0 && strcmp(cmd->name, "doctor") != 0) {
        fprintf(stderr, "zeparelayctl: --json belongs to \"status\" and \"doctor\"\n");
        return EXIT_USAGE;
    }
    if (opt.timeoutMs > 0 && strcmp(cmd->name, "doctor") != 0) {
        fprintf(stderr, "zeparelayctl: --timeout belongs to \"doctor\"\n");
        return EXIT_USAGE;
    }
    // The library logs to standard error; in a tool that would mix its lines
    // into the tool's own messages. Its readers report to the system log.
    if (!verbose) ZEPA::Relay::Daemon::_logLevel = -1;
    if (quiet && freopen("/dev/null", "w", stdout) == nullptr) return EXIT_BROKEN;
    Args args(argv + optind + 1, argv + argc);
    const int ret = cmd->run(args, opt);
    if (ret == EXIT_USAGE) {
        fprintf(stderr, "zeparelayctl: usage: zeparelayctl %s\n", cmd->synopsis);
    }
    return ret;
}
