// A stand-in for the VPN program, installed by the tunnel tests as
// <root>/usr/sbin/openvpn. It records what it was started with under
// <root>/standin/ (call N: argv.N, mode.N, pass.N, mask.N, tool.N) and then
// behaves as <root>/standin/behaviour.<proto word> says:
//   up        run the --route-up command, then wait for SIGTERM (default)
//   hang      neither signal nor die; wait for SIGTERM
//   exit      exit at once with status 1
//   late-exit exit with status 1 a moment later
//   kill-up   kill the process in <root>/standin/victim, then a moment later "up"
// On SIGTERM it writes term.N and exits with status 0.
#include <signal.h>
#include <sys/stat.h>
#include <sys/wait.h>
#include <unistd.h>

#include <climits>
#include <cstring>
#include <fstream>
#include <sstream>
#include <string>

namespace {

volatile sig_atomic_t g_terminated = 0;

void OnTerm(int) { g_terminated = 1; }

std::string ReadAll(const std::string& path) {
    std::ifstream in(path, std::ios::binary);
    std::ostringstream text;
    text << in.rdbuf();
    return text.str();
}

void WriteAll(const std::string& path, const std::string& content) {
    std::ofstream out(path, std::ios::binary | std::ios::trunc);
    out << content;
}

bool Exists(const std::string& path) {
    struct stat st;
    return stat(path.c_str(), &st) == 0;
}

std::string RootDir() {
    char exe[PATH_MAX] = {0};
    ssize_t n = readlink("/proc/self/exe", exe, sizeof(exe) - 1);
    if (n <= 0) _exit(3);
    std::string path(exe, static_cast<size_t>(n));
    const std::string suffix = "/usr/sbin/openvpn";
    if (path.size() < suffix.size() || path.compare(path.size() - suffix.size(), suffix.size(), suffix) != 0)
        _exit(3);
    return path.substr(0, path.size() - suffix.size());
}

std::string OptionValue(int argc, char** argv, const char* option) {
    for (int i = 1; i + 1 < argc; ++i)
        if (strcmp(argv[i], option) == 0) return argv[i + 1];
    return std::string();
}

std::string BlockedSignals() {
    sigset_t current;
    sigprocmask(SIG_BLOCK, nullptr, &current);
    std::string blocked;
    for (int sig = 1; sig < NSIG; ++sig)
        if (sigismember(&current, sig) == 1) blocked += std::to_string(sig) + " ";
    return blocked;
}

void RecordCall(const std::string& dir, int call, int argc, char** argv, const std::string& blocked) {
    const std::string n = std::to_string(call);
    std::string args;
    for (int i = 0; i < argc; ++i) args += std::string(argv[i]) + "\n";
    WriteAll(dir + "/argv." + n, args);

    const std::string pass = OptionValue(argc, argv, "--auth-user-pass");
    struct stat st;
    if (!pass.empty() && stat(pass.c_str(), &st) == 0) {
        char mode[16];
        snprintf(mode, sizeof(mode), "%o", static_cast<unsigned>(st.st_mode & 07777));
        WriteAll(dir + "/mode." + n, mode);
        WriteAll(dir + "/pass." + n, ReadAll(pass));
    }
    WriteAll(dir + "/mask." + n, blocked);
    WriteAll(dir + "/tool." + n, ReadAll(dir + "/iptablestool"));
}

void RunRouteUp(const std::string& command) {
    pid_t child = fork();
    if (child == 0) {
        execl("/bin/sh", "sh", "-c", command.c_str(), static_cast<char*>(nullptr));
        _exit(127);
    }
    if (child > 0) waitpid(child, nullptr, 0);
}

[[noreturn]] void WaitForTerm(const std::string& dir, int call) {
    sigset_t none;
    sigemptyset(&none);
    while (!g_terminated) sigsuspend(&none);
    WriteAll(dir + "/term." + std::to_string(call), "term");
    _exit(0);
}

}  // namespace

int main(int argc, char** argv) {
    struct sigaction action;
    memset(&action, 0, sizeof(action));
    action.sa_handler = OnTerm;
    sigaction(SIGTERM, &action, nullptr);
    // Block SIGTERM outside sigsuspend so that it cannot slip in unseen.
    sigset_t term;
    sigemptyset(&term);
    sigaddset(&term, SIGTERM);
    const std::string blockedAtStart = BlockedSignals();

    const std::string dir = RootDir() + "/standin";
    int call = 1;
    while (Exists(dir + "/argv." + std::to_string(call))) ++call;
    RecordCall(dir, call, argc, argv, blockedAtStart);
    sigprocmask(SIG_BLOCK, &term, nullptr);

    std::string behaviour = ReadAll(dir + "/behaviour." + OptionValue(argc, argv, "--proto"));
    while (!behaviour.empty() && (behaviour.back() == '\n' || behaviour.back() == ' ')) behaviour.pop_back();
    if (behaviour.empty()) behaviour = "up";

    if (behaviour == "exit") _exit(1);
    if (behaviour == "late-exit") {
        usleep(200 * 1000);
        _exit(1);
    }
    if (behaviour == "kill-up") {
        kill(std::stoi(ReadAll(dir + "/victim")), SIGKILL);
        usleep(200 * 1000);
        behaviour = "up";
    }
    if (behaviour == "up") RunRouteUp(OptionValue(argc, argv, "--route-up"));
    WaitForTerm(dir, call);
}
