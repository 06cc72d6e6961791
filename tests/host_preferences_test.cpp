// The text-preference store: INI files, set values, typed reads with
// defaults and statuses.
#include <gtest/gtest.h>

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
            "[Other]\n"
            "Minimum Volume Free Space (Gigabytes)=3\n");
  ASSERT_TRUE(ctl::LoadPreferencesFile(path));

  EXPECT_EQ(LongRead(0, 25), Long("Minimum Volume Free Space (Gigabytes)", 10));
  EXPECT_EQ(LongRead(0, 3), Long("Minimum Volume Free Space (Gigabytes)", 10, "Other"));
  EXPECT_EQ(FpRead(0, 2.5), Fp("Proclivity Multiplier 2", 1.0));
  // Missing keys give the default and success.
  EXPECT_EQ(LongRead(0, 10), Long("No Such Key", 10));
  EXPECT_EQ(FpRead(0, 1.0), Fp("No Such Key", 1.0));
}

TEST_F(HostPreferences, MalformedValuesGiveTheDefaultAndAStatus) {
  ctl::SetPreference(kSection, "Value", "12abc");
  EXPECT_EQ(LongRead(ST_ErrBadValue, 10), Long("Value", 10));
  ctl::SetPreference(kSection, "Value", "2147483648");  // out of range
  EXPECT_EQ(LongRead(ST_ErrBadValue, 10), Long("Value", 10));
  ctl::SetPreference(kSection, "Value", "nan");
  EXPECT_EQ(FpRead(ST_ErrBadValue, 1.5), Fp("Value", 1.5));
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
  for (const char* name : {"/broken.ini", "/missing.ini"})
    EXPECT_FALSE(ctl::LoadPreferencesFile(dir.Path() + name)) << name;
  EXPECT_EQ(LongRead(0, 1), Long("A", 0, "S"));
}

}  // namespace
