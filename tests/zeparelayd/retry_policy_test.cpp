// The daemon's retry policies against a clock the test moves by hand.
#include <gtest/gtest.h>

#include <climits>
#include <cstdlib>
#include <vector>

#include "fake_clock.h"
#include "retry_policy.h"

using namespace ZEPA::Relay;
using zeparelayd::AliasPolicy;
using zeparelayd::AliasStep;
using zeparelayd::BackoffRule;
using zeparelayd::JitterKind;
using zeparelayd::RegistrationPolicy;
using zeparelayd::RegistrationRules;
using zeparelayd::TunnelPolicy;
using zeparelayd::TunnelRules;

using zepatest::FakeClock;
using zepatest::FixedRandom;

namespace {

class RegistrationPolicyTest : public ::testing::Test {
protected:
    FakeClock clock;
    FixedRandom jitter;
    RegistrationPolicy policy{clock, jitter.Source()};
};

TEST_F(RegistrationPolicyTest, FailuresRetryAboutFiveMinutesAfterTheAttemptStarted) {
    for (int i = 1; i <= 8; ++i) {
        policy.OnAttempt();
        clock.Advance(50);
        // The wait does not grow: a long outage is left as soon as the relay is back.
        EXPECT_EQ(285000 - 50, policy.OnFailure(RELAYD_ERR_NETWORK)) << "failure " << i;
        EXPECT_EQ(i, policy.Failures());
        clock.Advance(285000);
    }
    EXPECT_FALSE(policy.Halted());
}

TEST_F(RegistrationPolicyTest, AnAttemptThatHungDoesNotDelayTheNext) {
    policy.OnAttempt();
    clock.Advance(90000);  // the request's time-out
    EXPECT_EQ(195000, policy.OnFailure(RELAYD_ERR_NETWORK));
    // An attempt that took longer than the wait is followed at once.
    policy.OnAttempt();
    clock.Advance(400000);
    EXPECT_EQ(0, policy.OnFailure(RELAYD_ERR_NETWORK));
}

TEST_F(RegistrationPolicyTest, JitterAddsUpToFifteenSeconds) {
    jitter.value = 14250;  // 5 % of 285 s: the most jitter there is
    EXPECT_EQ(299250, policy.BackoffMs(1));
    jitter.value = 14251;  // one more wraps round to no jitter
    EXPECT_EQ(285000, policy.BackoffMs(1));
    jitter.value = LONG_MIN;  // any value a source gives stays within the bounds
    EXPECT_GE(policy.BackoffMs(7), 285000);
    EXPECT_LE(policy.BackoffMs(7), 299250);

    // The daemon's own source spreads over the whole range, never outside it.
    RegistrationPolicy real(clock, [] { return random(); });
    int64_t lowest = LLONG_MAX, highest = 0;
    for (int i = 0; i < 2000; ++i) {
        const int64_t delay = real.BackoffMs(2);
        ASSERT_GE(delay, 285000);
        ASSERT_LE(delay, 299250);
        lowest = std::min(lowest, delay);
        highest = std::max(highest, delay);
    }
    EXPECT_LT(lowest, 286000);
    EXPECT_GT(highest, 298250);
}

TEST_F(RegistrationPolicyTest, ANameResolutionFailureCountsAsAFailure) {
    policy.OnAttempt();
    EXPECT_EQ(285000, policy.OnFailure(RELAYD_ERR_RESOLV));
    EXPECT_EQ(1, policy.Failures());
}

TEST_F(RegistrationPolicyTest, FailuresOnlyAReloadCuresWaitForIt) {
    for (RELAYD_RET err :
         {RELAYD_ERR_AUTH, RELAYD_ERR_NOT_SUPPORT, RELAYD_ERR_API_KEY_EXPIRED, RELAYD_ERR_CONFIG}) {
        policy.Reset();
        policy.OnFailure(RELAYD_ERR_NETWORK);
        EXPECT_EQ(RegistrationPolicy::WAIT_FOR_RELOAD, policy.OnFailure(err)) << err;
        EXPECT_TRUE(policy.Halted()) << err;
    }
    policy.Reset();
    EXPECT_FALSE(policy.Halted());
    EXPECT_EQ(0, policy.Failures());
    policy.OnAttempt();
    EXPECT_EQ(285000, policy.OnFailure(RELAYD_ERR_UNKNOWN));
}

TEST_F(RegistrationPolicyTest, ARunOfServerMovesBacksOffAfterTheFirst) {
    EXPECT_EQ(0, policy.OnServerMoved());
    EXPECT_EQ(285000, policy.OnServerMoved());
    EXPECT_EQ(285000, policy.OnServerMoved());
    EXPECT_EQ(3, policy.Moves());
    // A success ends the run: the next move is followed at once again.
    policy.OnSuccess();
    EXPECT_EQ(0, policy.Moves());
    EXPECT_EQ(0, policy.OnServerMoved());
}

TEST_F(RegistrationPolicyTest, TheFirstRegistrationWaitsUpToThreeMinutes) {
    jitter.value = 0;
    EXPECT_EQ(0, policy.OnStart());
    jitter.value = 180000;
    EXPECT_EQ(180000, policy.OnStart());
    jitter.value = 180001;
    EXPECT_EQ(0, policy.OnStart());
    jitter.value = 77777;
    EXPECT_EQ(77777, policy.OnStart());
}

TEST_F(RegistrationPolicyTest, SuccessStartsTheCountsAfresh) {
    policy.OnFailure(RELAYD_ERR_NETWORK);
    policy.OnFailure(RELAYD_ERR_NETWORK);
    policy.OnServerMoved();
    policy.OnSuccess();
    EXPECT_EQ(0, policy.Failures());
    EXPECT_EQ(0, policy.Moves());
}

TEST_F(RegistrationPolicyTest, DumpShowsTheBookkeeping) {
    policy.OnFailure(RELAYD_ERR_NETWORK);
    policy.OnServerMoved();
    clock.Advance(1000);
    Json::Value dump;
    policy.Dump(dump);
    EXPECT_EQ(1, dump["failures"].asInt());
    EXPECT_EQ(1, dump["moves"].asInt());
    EXPECT_FALSE(dump["halted"].asBool());
}

// The rule variants the fleet simulator compares, one wait each.
TEST(BackoffRuleTest, EachJitterKindStaysInItsRange) {
    FixedRandom jitter;
    const zeparelayd::RandomSource source = jitter.Source();
    const BackoffRule added{30000, 1800000, JitterKind::ADDED, 25};
    jitter.value = 0;
    EXPECT_EQ(30000, added.WaitMs(1, 0, source));
    EXPECT_EQ(1800000, added.WaitMs(8, 0, source));
    jitter.value = 7500;
    EXPECT_EQ(37500, added.WaitMs(1, 0, source));

    const BackoffRule full{120000, 300000, JitterKind::FULL, 0};
    jitter.value = 0;
    EXPECT_EQ(0, full.WaitMs(1, 0, source));
    jitter.value = 120000;
    EXPECT_EQ(120000, full.WaitMs(1, 0, source));
    jitter.value = 240000;
    EXPECT_EQ(240000, full.WaitMs(2, 0, source));
    jitter.value = 300000;
    EXPECT_EQ(300000, full.WaitMs(5, 0, source));

    const BackoffRule equal{240000, 240000, JitterKind::EQUAL, 0};
    jitter.value = 0;
    EXPECT_EQ(120000, equal.WaitMs(3, 0, source));
    jitter.value = 120000;
    EXPECT_EQ(240000, equal.WaitMs(3, 0, source));

    const BackoffRule decorrelated{30000, 300000, JitterKind::DECORRELATED, 0};
    jitter.value = 0;
    EXPECT_EQ(30000, decorrelated.WaitMs(1, 0, source));
    jitter.value = 60000;  // up to three times the previous wait
    EXPECT_EQ(90000, decorrelated.WaitMs(2, 30000, source));
    jitter.value = 270000;  // never above the cap
    EXPECT_EQ(300000, decorrelated.WaitMs(5, 200000, source));
}

TEST(BackoffRuleTest, TheRulesBeforeTheFleetWasMeasuredStillRun) {
    FakeClock clock;
    FixedRandom jitter;
    RegistrationRules before;
    before.failure = {30000, 1800000, JitterKind::ADDED, 25};
    before.resolveBacksOff = false;
    before.fromAttemptStart = false;
    before.startSpreadMs = 0;
    RegistrationPolicy policy(clock, jitter.Source(), before);
    const std::vector<int64_t> expected = {30000, 60000, 120000, 240000, 480000, 960000, 1800000, 1800000};
    for (size_t i = 0; i < expected.size(); ++i) {
        policy.OnAttempt();
        clock.Advance(90000);
        EXPECT_EQ(expected[i], policy.OnFailure(RELAYD_ERR_NETWORK)) << "failure " << i + 1;
    }
    EXPECT_EQ(10000, policy.OnFailure(RELAYD_ERR_RESOLV));
    EXPECT_EQ(0, policy.OnStart());
}

// The tunnel's variants: a close waits closedMs plus up to closedSpreadMs,
// a failed start follows its back-off whatever the close does.
TEST(TunnelRulesTest, AClosedTunnelWaitsItsFloorPlusUpToItsSpread) {
    FakeClock clock;
    FixedRandom jitter;
    TunnelRules rules;
    rules.closedMs = 2000;
    rules.closedSpreadMs = 60000;
    TunnelPolicy policy(clock, jitter.Source(), rules);
    jitter.value = 0;
    EXPECT_EQ(2000, policy.OnClosed());
    policy.OnUp();
    jitter.value = 60000;
    EXPECT_EQ(62000, policy.OnClosed());
    policy.OnUp();
    jitter.value = 60001;
    EXPECT_EQ(2000, policy.OnClosed());

    // No spread: exactly the floor; the rule before the fleet was measured
    // (2 s plus up to a quarter) is the floor 2 s and a spread of 0.5 s.
    rules.closedMs = 2000;
    rules.closedSpreadMs = 0;
    TunnelPolicy fixed(clock, jitter.Source(), rules);
    jitter.value = 12345;
    EXPECT_EQ(2000, fixed.OnClosed());
    rules.closedSpreadMs = 500;
    TunnelPolicy before(clock, jitter.Source(), rules);
    jitter.value = 500;
    EXPECT_EQ(2500, before.OnClosed());
    before.OnUp();
    EXPECT_EQ(2500, before.OnFailure());
}

class AliasPolicyTest : public ::testing::Test {
protected:
    static constexpr int POLL = 300;

    AliasStep Outcome(ALIAS_RET ret, ALIAS_REQUEST_CMD cmd = ALIAS_REQ_KEEP_ALIVE) {
        return policy.OnOutcome(cmd, ret, POLL, 420);
    }

    FakeClock clock;
    FixedRandom jitter;
    AliasPolicy policy{clock, jitter.Source()};
};

TEST_F(AliasPolicyTest, RegistrationMapsFirstAndKeepsAliveOnceMapped) {
    AliasStep step = policy.OnRegistered();
    EXPECT_TRUE(step.run);
    EXPECT_EQ(ALIAS_REQ_MAP, step.cmd);
    EXPECT_EQ(0, step.delayMs);

    step = Outcome(ALIAS_RET_SUCCESS, ALIAS_REQ_MAP);
    EXPECT_TRUE(step.run);
    EXPECT_EQ(ALIAS_REQ_KEEP_ALIVE, step.cmd);
    EXPECT_EQ(420000, step.delayMs);
    EXPECT_TRUE(policy.Mapped());

    step = policy.OnRegistered();
    EXPECT_EQ(ALIAS_REQ_KEEP_ALIVE, step.cmd);
}

TEST_F(AliasPolicyTest, NormalClassBacksOffUpToThePollPeriod) {
    for (ALIAS_RET ret : {ALIAS_RET_NETWORK, ALIAS_RET_SERVER_BUSY, ALIAS_RET_UNKNOWN, ALIAS_RET_SYSTEM}) {
        policy.Reset();
        const std::vector<int64_t> expected = {60000, 120000, 240000, 300000, 300000};
        for (size_t i = 0; i < expected.size(); ++i) {
            AliasStep step = Outcome(ret);
            EXPECT_TRUE(step.run) << ret;
            EXPECT_FALSE(step.cleanDns) << ret;
            EXPECT_EQ(ALIAS_REQ_KEEP_ALIVE, step.cmd) << ret;
            EXPECT_EQ(expected[i], step.delayMs) << ret << " failure " << i + 1;
        }
        EXPECT_EQ(ALIAS_RETRY_NORMAL, policy.RetryClass());
    }
    // A short poll period still waits a minute.
    policy.Reset();
    EXPECT_EQ(60000, policy.OnOutcome(ALIAS_REQ_MAP, ALIAS_RET_NETWORK, 10, 0).delayMs);
    EXPECT_EQ(60000, policy.OnOutcome(ALIAS_REQ_MAP, ALIAS_RET_NETWORK, 10, 0).delayMs);
}

TEST_F(AliasPolicyTest, NormalJitterAddsUpToHalfTheWait) {
    jitter.value = 30000;
    EXPECT_EQ(90000, policy.NormalBackoffMs(1, POLL));
    jitter.value = 30001;
    EXPECT_EQ(60000, policy.NormalBackoffMs(1, POLL));
    jitter.value = 150000;
    EXPECT_EQ(450000, policy.NormalBackoffMs(9, POLL));
}

TEST_F(AliasPolicyTest, AliasNotFoundMapsAgain) {
    Outcome(ALIAS_RET_SUCCESS, ALIAS_REQ_MAP);
    ASSERT_TRUE(policy.Mapped());
    AliasStep step = Outcome(ALIAS_RET_NOT_FOUND, ALIAS_REQ_KEEP_ALIVE);
    EXPECT_TRUE(step.run);
    EXPECT_EQ(ALIAS_REQ_MAP, step.cmd);
    EXPECT_EQ(60000, step.delayMs);
    EXPECT_FALSE(policy.Mapped());
    EXPECT_EQ(ALIAS_REQ_MAP, policy.OnRegistered().cmd);
}

TEST_F(AliasPolicyTest, ResolveClassForgetsTheCacheAndRetriesWithinHalfAMinute) {
    jitter.value = 0;
    AliasStep step = Outcome(ALIAS_RET_DNS, ALIAS_REQ_MAP);
    EXPECT_TRUE(step.run);
    EXPECT_TRUE(step.cleanDns);
    EXPECT_EQ(ALIAS_REQ_MAP, step.cmd);
    EXPECT_EQ(20000, step.delayMs);
    EXPECT_EQ(ALIAS_RETRY_RESOLVE, policy.RetryClass());
    jitter.value = 9999;
    EXPECT_EQ(29999, Outcome(ALIAS_RET_DNS).delayMs);
    jitter.value = 10000;
    EXPECT_EQ(20000, Outcome(ALIAS_RET_DNS).delayMs);
    // Repeated resolve failures do not grow the wait.
    jitter.value = 0;
    EXPECT_EQ(20000, Outcome(ALIAS_RET_DNS).delayMs);
}

TEST_F(AliasPolicyTest, StopClassWaitsForAReload) {
    for (ALIAS_RET ret : {ALIAS_RET_AUTH, ALIAS_RET_BAD_IP, ALIAS_RET_INUSED, ALIAS_RET_SELF_INUSED}) {
        policy.Reset();
        policy.OnRegistered();
        AliasStep step = Outcome(ret);
        EXPECT_FALSE(step.run) << ret;
        EXPECT_TRUE(policy.Halted()) << ret;
        EXPECT_EQ(ALIAS_RETRY_STOP, policy.RetryClass()) << ret;
        // A new registration does not restart it ...
        EXPECT_FALSE(policy.OnRegistered().run) << ret;
        // ... an explicit request does, at once.
        AliasStep asked = policy.OnRequested();
        EXPECT_TRUE(asked.run);
        EXPECT_EQ(0, asked.delayMs);
    }
    policy.Reset();
    EXPECT_FALSE(policy.Halted());
    EXPECT_TRUE(policy.OnRegistered().run);
}

TEST_F(AliasPolicyTest, IncompleteDataWaitsForAReload) {
    policy.OnIncompleteData();
    EXPECT_TRUE(policy.Halted());
    EXPECT_FALSE(policy.OnRegistered().run);
}

TEST_F(AliasPolicyTest, ARequestThatDidNotStartCountsAsANormalFailure) {
    EXPECT_EQ(60000, policy.OnNotStarted(ALIAS_REQ_MAP, POLL).delayMs);
    EXPECT_EQ(120000, policy.OnNotStarted(ALIAS_REQ_MAP, POLL).delayMs);
    EXPECT_EQ(2, policy.Failures());
    EXPECT_EQ(ALIAS_REQ_KEEP_ALIVE, Outcome(ALIAS_RET_SUCCESS).cmd);
    EXPECT_EQ(0, policy.Failures());
}

TEST_F(AliasPolicyTest, DumpShowsTheBookkeeping) {
    Outcome(ALIAS_RET_NETWORK);
    clock.Advance(45000);
    Json::Value dump;
    policy.Dump(dump);
    EXPECT_EQ(1, dump["failures"].asInt());
    EXPECT_EQ(ALIAS_RETRY_NORMAL, dump["retry_class"].asInt());
    EXPECT_FALSE(dump["halted"].asBool());
    EXPECT_FALSE(dump["mapped"].asBool());
}

}  // namespace
