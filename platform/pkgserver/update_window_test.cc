// The maintenance window's rules on fixed times of a fixed time zone: which
// settings it takes (whole or not at all), when it is open, when it opens
// next, that a run goes once per opening, that the random delay ends before
// the window closes, and when a hold until a date ends.

#include "pkgserver/update_window.h"

#include <cstdlib>
#include <ctime>

#include <gtest/gtest.h>

#include "pkgserver/update_holds.h"

namespace {

using namespace KIVOPackageServer;

class UpdateWindowTest : public ::testing::Test {
 protected:
  void SetUp() override {
    // Local time is what the window speaks; the test fixes it.
    setenv("TZ", "UTC", 1);
    tzset();
  }
  static int64_t At(const std::string& local) {
    int64_t t = 0;
    EXPECT_TRUE(ParseLocalTime(local, &t)) << local;
    return t;
  }
  static UpdateWindow Parse(const KeyValueMap& conf) {
    UpdateWindow w;
    WindowError error;
    EXPECT_TRUE(ParseUpdateWindow(conf, &w, &error)) << error.key << ": " << error.reason;
    return w;
  }
  static WindowError Refused(const KeyValueMap& conf) {
    UpdateWindow w;
    w.random_delay_minutes = 7;
    WindowError error;
    EXPECT_FALSE(ParseUpdateWindow(conf, &w, &error));
    EXPECT_EQ(7, w.random_delay_minutes);  // untouched
    return error;
  }
};

TEST_F(UpdateWindowTest, TakesAWholeWindowAndWritesItBackAsItIs) {
  const UpdateWindow w = Parse({{"window_days", "mon,wed,sun"},
                                {"window_start", "02:00"},
                                {"window_end", "05:30"},
                                {"random_delay_minutes", "30"}});
  EXPECT_TRUE(w.limited);
  EXPECT_EQ((1u << 1) | (1u << 3) | (1u << 0), w.days);
  EXPECT_EQ(120, w.start_minute);
  EXPECT_EQ(330, w.end_minute);
  EXPECT_EQ(30, w.random_delay_minutes);
  const UpdateWindow again = Parse(KIVOKeyValueParse(UpdateWindowText(w)));
  EXPECT_EQ(UpdateWindowText(w), UpdateWindowText(again));
  EXPECT_EQ("mon,wed,sun", KIVOKeyValueParse(UpdateWindowText(w))["window_days"]);

  const UpdateWindow any = Parse({});
  EXPECT_FALSE(any.limited);
  EXPECT_EQ(0, any.random_delay_minutes);
  EXPECT_FALSE(Parse({{"window_days", ""}, {"random_delay_minutes", "5"}}).limited);
  EXPECT_EQ(1440,
            Parse({{"window_days", "sat"}, {"window_start", "00:00"}, {"window_end", "24:00"}})
                .end_minute);
}

TEST_F(UpdateWindowTest, RefusesAnyBadPartAndNamesIt) {
  const KeyValueMap good = {{"window_days", "mon"},
                            {"window_start", "02:00"},
                            {"window_end", "05:00"},
                            {"random_delay_minutes", "30"}};
  auto with = [&](const std::string& key, const std::string& value) {
    KeyValueMap conf = good;
    conf[key] = value;
    return conf;
  };
  EXPECT_EQ("window_days", Refused(with("window_days", "monday")).key);
  EXPECT_EQ("window_days", Refused(with("window_days", "mon,mon")).key);
  EXPECT_EQ("window_days", Refused(with("window_days", "mon,")).key);
  EXPECT_EQ("window_days", Refused(with("window_days", "mon;rm -rf /")).key);
  EXPECT_EQ("window_days", Refused(with("surprise", "1")).key);
  EXPECT_EQ("window_days", Refused({{"window_start", "02:00"}, {"window_end", "03:00"}}).key);
  EXPECT_EQ("window_start", Refused(with("window_start", "24:00")).key);
  EXPECT_EQ("window_start", Refused(with("window_start", "2:00")).key);
  EXPECT_EQ("window_start", Refused(with("window_start", "")).key);
  EXPECT_EQ("window_end", Refused(with("window_end", "05:60")).key);
  EXPECT_EQ("window_end", Refused(with("window_end", "00:00")).key);
  EXPECT_EQ("window_end", Refused(with("window_end", "02:00")).key);
  EXPECT_EQ("random_delay_minutes", Refused(with("random_delay_minutes", "721")).key);
  EXPECT_EQ("random_delay_minutes", Refused(with("random_delay_minutes", "-1")).key);
  EXPECT_EQ("random_delay_minutes", Refused(with("random_delay_minutes", "99999999999")).key);
}

TEST_F(UpdateWindowTest, OpenOnItsDaysAndHoursOnly) {
  // 2024-05-06 is a Monday.
  const UpdateWindow w =
      Parse({{"window_days", "mon,thu"}, {"window_start", "02:00"}, {"window_end", "05:00"}});
  WindowState s = WindowStateAt(w, At("2024-05-06T03:00"), 0);
  EXPECT_TRUE(s.inside);
  EXPECT_FALSE(s.already_ran);
  EXPECT_EQ(At("2024-05-06T02:00"), s.current.opens);
  EXPECT_EQ(At("2024-05-06T05:00"), s.current.closes);
  ASSERT_TRUE(s.has_next);
  EXPECT_EQ(At("2024-05-06T02:00"), s.next.opens);  // now, not run yet

  s = WindowStateAt(w, At("2024-05-06T05:00"), 0);
  EXPECT_FALSE(s.inside);
  ASSERT_TRUE(s.has_next);
  EXPECT_EQ(At("2024-05-09T02:00"), s.next.opens);
  EXPECT_EQ(At("2024-05-09T05:00"), s.next.closes);

  s = WindowStateAt(w, At("2024-05-05T23:59"), 0);  // a Sunday
  EXPECT_FALSE(s.inside);
  EXPECT_EQ(At("2024-05-06T02:00"), s.next.opens);
  EXPECT_FALSE(WindowStateAt(w, At("2024-05-07T03:00"), 0).inside);  // a Tuesday

  // Once per opening: a run that started in it makes the next one wait for
  // the next opening.
  s = WindowStateAt(w, At("2024-05-06T04:00"), At("2024-05-06T02:10"));
  EXPECT_TRUE(s.inside);
  EXPECT_TRUE(s.already_ran);
  EXPECT_EQ(At("2024-05-09T02:00"), s.next.opens);
  EXPECT_FALSE(WindowStateAt(w, At("2024-05-06T04:00"), At("2024-05-06T01:59")).already_ran);

  // Without a window: any time, no next opening to tell.
  s = WindowStateAt(Parse({}), At("2024-05-07T03:00"), At("2024-05-07T02:00"));
  EXPECT_TRUE(s.inside);
  EXPECT_FALSE(s.already_ran);
  EXPECT_FALSE(s.has_next);
}

TEST_F(UpdateWindowTest, AWindowPastMidnightBelongsToTheDayItOpens) {
  const UpdateWindow w =
      Parse({{"window_days", "fri"}, {"window_start", "22:00"}, {"window_end", "02:00"}});
  // 2024-05-10 is a Friday.
  WindowState s = WindowStateAt(w, At("2024-05-11T01:00"), 0);
  EXPECT_TRUE(s.inside);
  EXPECT_EQ(At("2024-05-10T22:00"), s.current.opens);
  EXPECT_EQ(At("2024-05-11T02:00"), s.current.closes);
  EXPECT_FALSE(WindowStateAt(w, At("2024-05-11T02:00"), 0).inside);
  EXPECT_FALSE(WindowStateAt(w, At("2024-05-10T01:00"), 0).inside);  // Thursday's night
  EXPECT_EQ(At("2024-05-17T22:00"), WindowStateAt(w, At("2024-05-11T02:00"), 0).next.opens);
}

TEST_F(UpdateWindowTest, TheRandomDelayEndsBeforeTheWindowCloses) {
  const UpdateWindow w = Parse({{"window_days", "mon"},
                                {"window_start", "02:00"},
                                {"window_end", "05:00"},
                                {"random_delay_minutes", "60"}});
  const int64_t early = At("2024-05-06T02:00"), late = At("2024-05-06T04:50");
  bool spread = false;
  for (uint64_t seed = 0; seed < 200; ++seed) {
    const int64_t d = RandomDelaySeconds(w, WindowStateAt(w, early, 0), early, seed);
    EXPECT_GE(d, 0);
    EXPECT_LT(d, 3600);
    spread = spread || d > 600;
    const int64_t bounded = RandomDelaySeconds(w, WindowStateAt(w, late, 0), late, seed);
    EXPECT_GE(bounded, 0);
    EXPECT_LT(late + bounded, At("2024-05-06T05:00")) << seed;
    EXPECT_EQ(d, RandomDelaySeconds(w, WindowStateAt(w, early, 0), early, seed));
  }
  EXPECT_TRUE(spread);  // not all at the start
  UpdateWindow none = w;
  none.random_delay_minutes = 0;
  EXPECT_EQ(0, RandomDelaySeconds(none, WindowStateAt(none, early, 0), early, 42));
}

TEST_F(UpdateWindowTest, AHoldUntilADateEndsAsThatDayBegins) {
  EXPECT_TRUE(IsHoldDate("2024-02-29"));
  EXPECT_FALSE(IsHoldDate("2023-02-29"));
  EXPECT_FALSE(IsHoldDate("2024-13-01"));
  EXPECT_FALSE(IsHoldDate("2024-1-01"));
  EXPECT_FALSE(IsHoldDate("1999-12-31"));
  EXPECT_FALSE(IsHoldDate("2024-06-01; rm"));
  UpdateHold hold{"2024-06-01", 0, "admin"};
  EXPECT_TRUE(HoldHolds(hold, At("2024-05-31T23:59")));
  EXPECT_FALSE(HoldHolds(hold, At("2024-06-01T00:00")));
  EXPECT_TRUE(HoldHolds({"", 0, "admin"}, At("2099-01-01T00:00")));
  int64_t t = 0;
  EXPECT_FALSE(ParseLocalTime("2024-02-30T01:00", &t));
  EXPECT_FALSE(ParseLocalTime("2024-05-06T24:00", &t));
  EXPECT_FALSE(ParseLocalTime("tomorrow", &t));
}

}  // namespace
