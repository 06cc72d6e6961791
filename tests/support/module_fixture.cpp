#include "support/module_fixture.h"

#include <algorithm>

namespace rktest {

std::vector<Verification> Verifications() {
  std::vector<Verification> out;
  for (const auto& v : rkhost::control::Snapshot().verifications) out.emplace_back(v.number, v.message);
  return out;
}

std::vector<std::string> ReportDetails() {
  std::vector<std::string> out;
  for (const auto& r : rkhost::control::Snapshot().errorReports) {
    EXPECT_EQ(r.group, 0x3A0000);
    EXPECT_EQ(r.number, 2);
    out.push_back(r.detail);
  }
  return out;
}

void ModuleTest::SetUp() {
  rkhost::control::MakeCurrentThreadMain();
  RK_Birth(false);
  rkhost::control::ClearCaptured();
  bag = RK_GlobalBag();
  dir = RK_GlobalSortDir();
}

void ModuleTest::TearDown() {
  bag.reset();
  dir.reset();
  RK_StopAllAsyncWork();
  RK_Death();
}

bool ModuleTest::Indexed(const RK_Stuff& item) const {
  const auto group = Group(item);
  return std::find(group.begin(), group.end(), &item) != group.end();
}

}  // namespace rktest
