// The text-preference store: INI files, set values, typed reads with
// defaults and statuses.
#include <gtest/gtest.h>

#include <cstdio>
#include <cstdlib>
#include <fstream>
#include <string>
#include <utility>

#include "host/control.h"
#include "host/hk.h"
#include "support/temp_dir.h"

namespace ctl = rkhost::control;

namespace {

constexpr const char kSection[] = "Additional Disk Cache Controls";

void WriteFile(const std::string& path, const std::string& text) {
  std::ofstream out(path, std::ios::binary | std::ios::trunc);
  out << text;
}

// A read's status and the value it gave.
using LongRead = std::pair<int, std::int32_t>;
using FpRead = std::pair<int, double>;

class HostPreferences : public ::testing::Test {
 protected:
  void SetUp() override { ctl::ClearPreferences(); }
  void TearDown() override { ctl::ClearPreferences(); }

  static LongRead Long(const char* key, std::int32_t def, const char* section = kSection) {
    std::int32_t value = 0;
    const int status = ST_GetTextPrefLong(ST_GetPrefHandle(0), section, key, def, &value);
    return {status, value};
  }
  static FpRead Fp(const char* key, double def) {
    double value = 0;
    const int status = ST_GetTextPrefFpLong(ST_GetPrefHandle(0), kSection, key, def, &value);
    return {status, value};
  }
};

TEST_F(HostPreferences, ValuesFromAnIniFile) {
  rktest::TempDir dir;
  const std::string path = dir.Path() + "/prefs.ini";
  WriteFile(path,
            "; disk cache tuning\n"
            "[Additional Disk Cache Controls]\n"
            "Minimum Volume Free Space (Gigabytes) = 25\n"
            "Proclivity Multiplier 2 =  2.5  \n"
            "Dont Include Speeds Above This In Average (bytes/sec) 2=1e9\n"
            "Lowest = -2147483648\n"
            "[Other]\n"
            "Minimum Volume Free Space (Gigabytes)=3\n");
  ASSERT_TRUE(ctl::LoadPreferencesFile(path));

  EXPECT_EQ(LongRead(0, 25), Long("Minimum Volume Free Space (Gigabytes)", 10));
  EXPECT_EQ(LongRead(0, 3), Long("Minimum Volume Free Space (Gigabytes)", 10, "Other"));
  EXPECT_EQ(LongRead(0, INT32_MIN), Long("Lowest", 10));
  EXPECT_EQ(FpRead(0, 2.5), Fp("Proclivity Multiplier 2", 1.0));
  EXPECT_EQ(FpRead(0, 1e9), Fp("Dont Include Speeds Above This In Average (bytes/sec) 2", 2147483648.0));
  EXPECT_EQ(FpRead(0, 25.0),
            Fp("Minimum Volume Free Space (Gigabytes)", 1.0));  // an integer is a fine double
  // Missing keys and sections give the default and success.
  EXPECT_EQ(LongRead(0, 10), Long("No Such Key", 10));
  EXPECT_EQ(LongRead(0, 11), Long("Lowest", 11, "No Such Section"));
  EXPECT_EQ(FpRead(0, 1.0), Fp("No Such Key", 1.0));
}

TEST_F(HostPreferences, MalformedValuesGiveTheDefaultAndAStatus) {
  for (const char* text : {"12abc", "2147483648", "-2147483649", "1.0", "", "0x10", "1 2"}) {
    ctl::SetPreference(kSection, "Value", text);
    EXPECT_EQ(LongRead(ST_ErrBadValue, 10), Long("Value", 10)) << '"' << text << '"';
  }
  for (const char* text : {"nan", "inf", "-inf", "1e999", "2.5x", "", "one"}) {
    ctl::SetPreference(kSection, "Value", text);
    EXPECT_EQ(FpRead(ST_ErrBadValue, 1.5), Fp("Value", 1.5)) << '"' << text << '"';
  }
  // Surrounding spaces are allowed in set values as in files.
  ctl::SetPreference(kSection, "Value", "  -42 ");
  EXPECT_EQ(LongRead(0, -42), Long("Value", 10));
}

TEST_F(HostPreferences, HandlesAndParameters) {
  EXPECT_NE(nullptr, ST_GetPrefHandle(0));
  EXPECT_EQ(nullptr, ST_GetPrefHandle(1));
  ctl::SetPreference(kSection, "Value", "5");

  int notAStore = 0;
  std::int32_t l = 0;
  double d = 0;
  EXPECT_EQ(ST_ErrBadHandle, ST_GetTextPrefLong(&notAStore, kSection, "Value", 10, &l));
  EXPECT_EQ(10, l);
  EXPECT_EQ(ST_ErrBadHandle, ST_GetTextPrefFpLong(nullptr, kSection, "Value", 2.0, &d));
  EXPECT_EQ(HK_ErrBadParameter, ST_GetTextPrefLong(ST_GetPrefHandle(0), nullptr, "Value", 10, &l));
  EXPECT_EQ(HK_ErrBadParameter, ST_GetTextPrefLong(ST_GetPrefHandle(0), kSection, "Value", 10, nullptr));
  EXPECT_EQ(LongRead(0, 5), Long("Value", 10));
}

TEST_F(HostPreferences, LoadingReplacesValuesAndAFailedLoadKeepsThem) {
  rktest::TempDir dir;
  const std::string good = dir.Path() + "/good.ini";
  WriteFile(good, "[S]\nA=1\n");
  ctl::SetPreference("S", "B", "2");
  ASSERT_TRUE(ctl::LoadPreferencesFile(good));
  EXPECT_EQ(LongRead(0, 1), Long("A", 0, "S"));
  EXPECT_EQ(LongRead(0, -1), Long("B", -1, "S"));  // the set value went with the load

  WriteFile(dir.Path() + "/broken.ini", "[S\nA=9\n");
  WriteFile(dir.Path() + "/duplicate.ini", "[S]\nA=9\nA=10\n");
  for (const char* name : {"/broken.ini", "/duplicate.ini", "/missing.ini"})
    EXPECT_FALSE(ctl::LoadPreferencesFile(dir.Path() + name)) << name;
  EXPECT_EQ(LongRead(0, 1), Long("A", 0, "S"));

  ctl::SetPreference("S", "A", "7");
  EXPECT_EQ(LongRead(0, 7), Long("A", 0, "S"));
  ctl::ClearPreferences();
  EXPECT_EQ(LongRead(0, 0), Long("A", 0, "S"));
}

// The environment variable is read when the store is first used, so the
// check runs in a fresh process.
TEST(HostPreferencesEnvironment, FileNamedByTheEnvironmentIsLoadedAtFirstUse) {
  GTEST_FLAG_SET(death_test_style, "threadsafe");
  EXPECT_EXIT(
      {
        int status = 1;
        {
          rktest::TempDir dir;
          const std::string path = dir.Path() + "/env.ini";
          WriteFile(path, "[Additional Disk Cache Controls]\nProclivity Multiplier 2 = 4.25\n");
          setenv("RKHOST_PREFERENCES", path.c_str(), 1);
          double d = 0;
          const int read =
              ST_GetTextPrefFpLong(ST_GetPrefHandle(0), kSection, "Proclivity Multiplier 2", 1.0, &d);
          std::fprintf(stderr, "status=%d value=%g\n", read, d);
          status = read == 0 && d == 4.25 ? 0 : 1;
        }
        std::exit(status);
      },
      ::testing::ExitedWithCode(0), "status=0 value=4.25");
}

}  // namespace
