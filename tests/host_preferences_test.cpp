// The text-preference store: INI files, set values, typed reads with
// defaults and statuses.
#include <gtest/gtest.h>

#include <cstdio>
#include <cstdlib>
#include <fstream>
#include <string>

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

class HostPreferences : public ::testing::Test {
 protected:
  void SetUp() override { ctl::ClearPreferences(); }
  void TearDown() override { ctl::ClearPreferences(); }

  // Reads a long and returns the status; the value goes to *out.
  static int Long(const char* key, std::int32_t def, std::int32_t* out, const char* section = kSection) {
    return ST_GetTextPrefLong(ST_GetPrefHandle(0), section, key, def, out);
  }
  static int Fp(const char* key, double def, double* out) {
    return ST_GetTextPrefFpLong(ST_GetPrefHandle(0), kSection, key, def, out);
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

  std::int32_t l = 0;
  double d = 0;
  EXPECT_EQ(0, Long("Minimum Volume Free Space (Gigabytes)", 10, &l));
  EXPECT_EQ(25, l);
  EXPECT_EQ(0, Long("Minimum Volume Free Space (Gigabytes)", 10, &l, "Other"));
  EXPECT_EQ(3, l);
  EXPECT_EQ(0, Long("Lowest", 10, &l));
  EXPECT_EQ(INT32_MIN, l);
  EXPECT_EQ(0, Fp("Proclivity Multiplier 2", 1.0, &d));
  EXPECT_DOUBLE_EQ(2.5, d);
  EXPECT_EQ(0, Fp("Dont Include Speeds Above This In Average (bytes/sec) 2", 2147483648.0, &d));
  EXPECT_DOUBLE_EQ(1e9, d);
  // An integer is a fine double.
  EXPECT_EQ(0, Fp("Minimum Volume Free Space (Gigabytes)", 1.0, &d));
  EXPECT_DOUBLE_EQ(25.0, d);

  // Missing keys and sections give the default and success.
  l = 0;
  EXPECT_EQ(0, Long("No Such Key", 10, &l));
  EXPECT_EQ(10, l);
  EXPECT_EQ(0, Long("Lowest", 11, &l, "No Such Section"));
  EXPECT_EQ(11, l);
  EXPECT_EQ(0, Fp("No Such Key", 1.0, &d));
  EXPECT_DOUBLE_EQ(1.0, d);
}

TEST_F(HostPreferences, MalformedValuesGiveTheDefaultAndAStatus) {
  const char* badLongs[] = {"12abc", "2147483648", "-2147483649", "1.0", "", "0x10", "1 2"};
  for (const char* text : badLongs) {
    ctl::SetPreference(kSection, "Value", text);
    std::int32_t l = 0;
    EXPECT_EQ(ST_ErrBadValue, Long("Value", 10, &l)) << '"' << text << '"';
    EXPECT_EQ(10, l) << '"' << text << '"';
  }
  const char* badDoubles[] = {"nan", "inf", "-inf", "1e999", "2.5x", "", "one"};
  for (const char* text : badDoubles) {
    ctl::SetPreference(kSection, "Value", text);
    double d = 0;
    EXPECT_EQ(ST_ErrBadValue, Fp("Value", 1.5, &d)) << '"' << text << '"';
    EXPECT_DOUBLE_EQ(1.5, d) << '"' << text << '"';
  }
  // Surrounding spaces are allowed in set values as in files.
  ctl::SetPreference(kSection, "Value", "  -42 ");
  std::int32_t l = 0;
  EXPECT_EQ(0, Long("Value", 10, &l));
  EXPECT_EQ(-42, l);
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
  EXPECT_EQ(0, ST_GetTextPrefLong(ST_GetPrefHandle(0), kSection, "Value", 10, &l));
  EXPECT_EQ(5, l);
}

TEST_F(HostPreferences, LoadingReplacesValuesAndAFailedLoadKeepsThem) {
  rktest::TempDir dir;
  const std::string good = dir.Path() + "/good.ini";
  WriteFile(good, "[S]\nA=1\n");
  ctl::SetPreference("S", "B", "2");
  ASSERT_TRUE(ctl::LoadPreferencesFile(good));
  std::int32_t l = 0;
  EXPECT_EQ(0, Long("A", 0, &l, "S"));
  EXPECT_EQ(1, l);
  EXPECT_EQ(0, Long("B", -1, &l, "S"));
  EXPECT_EQ(-1, l);  // the set value went with the load

  const std::string broken = dir.Path() + "/broken.ini";
  WriteFile(broken, "[S\nA=9\n");
  EXPECT_FALSE(ctl::LoadPreferencesFile(broken));
  const std::string duplicate = dir.Path() + "/duplicate.ini";
  WriteFile(duplicate, "[S]\nA=9\nA=10\n");
  EXPECT_FALSE(ctl::LoadPreferencesFile(duplicate));
  EXPECT_FALSE(ctl::LoadPreferencesFile(dir.Path() + "/missing.ini"));
  EXPECT_EQ(0, Long("A", 0, &l, "S"));
  EXPECT_EQ(1, l);

  ctl::SetPreference("S", "A", "7");
  EXPECT_EQ(0, Long("A", 0, &l, "S"));
  EXPECT_EQ(7, l);
  ctl::ClearPreferences();
  EXPECT_EQ(0, Long("A", 0, &l, "S"));
  EXPECT_EQ(0, l);
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
