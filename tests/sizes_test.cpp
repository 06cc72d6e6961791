// Size reporting: the memory and disk totals of the bag's items and the
// running size of the disk cache.
#include <cstdint>

#include "support/module_fixture.h"

namespace {

using rktest::TestStuff;
using SizesTest = rktest::ModuleTest;

TEST_F(SizesTest, TotalsCountItemsByWhereTheirDataLives) {
  auto local = boost::shared_ptr<RK_Bag>(new RK_Bag);
  auto memOnly = TestStuff::Make(1);
  auto both = TestStuff::Make(20);
  both->SetOnDisk(true);
  auto diskOnly = TestStuff::Make(300, false);
  diskOnly->SetOnDisk(true);
  auto neither = TestStuff::Make(4000, false);
  neither->SetOnDisk(false);
  auto checkedOut = TestStuff::Make(50000);
  RK_TEST_Access::SetCheckoutCount(*checkedOut, 1);
  auto big = TestStuff::Make(0xFFFFFFFFu);  // widened, not wrapped
  for (auto* s : {memOnly.get(), both.get(), diskOnly.get(), neither.get(), checkedOut.get(), big.get()})
    local->AddStuff(s);
  std::uint64_t memory = 7, disk = 7;
  local->GetCacheSizesInBytes(memory, disk);
  EXPECT_EQ(memory, 1u + 20u + 50000u + 0xFFFFFFFFull);
  EXPECT_EQ(disk, 20u + 300u);

  // A throwing item ends the walk; the totals so far stay in the outputs.
  both->SetThrowFromIsInMemory(9);
  EXPECT_EQ(rktest::ThrownCode([&] { local->GetCacheSizesInBytes(memory, disk); }), 9);
  EXPECT_EQ(memory, 1u);
  EXPECT_EQ(disk, 0u);
  both->SetThrowFromIsInMemory(0);

  RK_TEST_Access::SetDiskCacheSize(*local, 123456789012);
  EXPECT_EQ(local->GetCurrentDiskCacheSize(), 123456789012);
  RK_TEST_Access::SetCheckoutCount(*checkedOut, 0);
  local.reset();
}

}  // namespace
