// "zeparelayctl doctor": every link the relay depends on, checked in order,
// each with its verdict (ok, warn, fail, skipped), its time and, when
// something is wrong, what is wrong and what to do. It only looks: nothing
// is registered, mapped, written or signalled (signal 0 aside).
//
// --json prints one object:
//   {"schema": 1, "result": "ok"|"warn"|"fail", "exit_status": 0|1|2,
//    "time_ms": INT, "timeout_ms": INT,
//    "checks": [{"name": STRING, "result": "ok"|"warn"|"fail"|"skipped",
//                "time_ms": INT, "detail": STRING, "hint": STRING}, ...],
//    "services": [{"id": STRING, "name": STRING, "port": INT|null,
//                  "ext_port": INT|null}, ...]}
// "hint" is empty unless the result is warn or fail.
#ifndef ZEPARELAYD_TOOL_CTL_DOCTOR_H
#define ZEPARELAYD_TOOL_CTL_DOCTOR_H

#include <json/value.h>

#include <string>
#include <vector>

namespace zeparelayctl {

enum class Verdict { OK, WARN, FAIL, SKIPPED };

const char* VerdictWord(Verdict v);

struct CheckResult {
    std::string name;
    Verdict verdict = Verdict::SKIPPED;
    long timeMs = 0;
    std::string detail;
    std::string hint;
};

struct DoctorReport {
    std::vector<CheckResult> checks;
    Json::Value services{Json::arrayValue};
    long timeMs = 0;
    int timeoutMs = 0;
    // 0 all ok (skipped counts as ok), 1 warnings only, 2 a failure.
    int ExitStatus() const;
    Json::Value ToJson() const;
    // Aligned lines, a colour mark when colour is true, the services table
    // and a summary line.
    std::string ToText(bool colour) const;
};

// Runs every check; each network step gives up after timeoutMs.
DoctorReport RunDoctor(int timeoutMs);

// Default time-out of each network step.
constexpr int DOCTOR_DEFAULT_TIMEOUT_MS = 5000;

}  // namespace zeparelayctl

#endif
