// The round trip every configuration section owes: its written (persistent)
// form, read back by Overwrite into a fresh object, gives an equal object.
// Equal means the same persistent form and, for sections that compare
// themselves (operator==), equal under that comparison too.
#ifndef ZEPARELAYD_TESTS_SUPPORT_ROUND_TRIP_H
#define ZEPARELAYD_TESTS_SUPPORT_ROUND_TRIP_H

#include <gtest/gtest.h>
#include <json/value.h>
#include <json/writer.h>

#include <memory>
#include <type_traits>
#include <utility>

#include <zeparelayd/config_base.h>

namespace zepatest {

namespace detail {
template <typename T, typename = void>
struct Comparable : std::false_type {};
template <typename T>
struct Comparable<T, std::void_t<decltype(std::declval<const T&>() == std::declval<const T&>())>>
    : std::true_type {};

inline std::string Compact(const Json::Value& value) {
    Json::FastWriter writer;
    return writer.write(value);
}
}  // namespace detail

// Writes original's persistent form, makes the read-back object from it with
// read (as the configuration's reader makes it: read(written) returns the
// section, or nullptr when it refuses the form) and compares the two.
// Use: EXPECT_TRUE(zepatest::RoundTripsVia(original, read)).
template <typename Section, typename Read>
::testing::AssertionResult RoundTripsVia(const Section& original, Read read) {
    static_assert(std::is_base_of<ZEPA::Relay::Config, Section>::value, "a configuration section");
    Json::Value written;
    if (!original.Write(written, false)) return ::testing::AssertionFailure() << "Write(persistent) failed";
    std::unique_ptr<Section> back = read(written);
    if (!back) {
        return ::testing::AssertionFailure()
               << "the reader refused its own written form " << detail::Compact(written);
    }
    const Section& fresh = *back;
    Json::Value again;
    if (!fresh.Write(again, false))
        return ::testing::AssertionFailure() << "Write of the read-back object failed";
    if (again != written) {
        return ::testing::AssertionFailure()
               << "written " << detail::Compact(written) << "read back as " << detail::Compact(again);
    }
    if constexpr (detail::Comparable<Section>::value) {
        if (!(fresh == original)) {
            return ::testing::AssertionFailure()
                   << "read-back object differs from " << detail::Compact(written);
        }
    }
    return ::testing::AssertionSuccess();
}

// The same, read back by Overwrite into fresh (a default object of the section).
// Use: EXPECT_TRUE(zepatest::RoundTrips(original, fresh)).
template <typename Section>
::testing::AssertionResult RoundTrips(const Section& original, Section& fresh) {
    return RoundTripsVia(original, [&fresh](const Json::Value& written) {
        std::unique_ptr<Section> view;
        if (fresh.Overwrite(written)) view.reset(new Section(fresh));
        return view;
    });
}

}  // namespace zepatest

#endif
