// Cache file identity and deletion: the item's file, the bag's total, the
// change count and the main-thread notification. A conversion to writeable
// makes the cached copy stale, which is how deletion is reached.
#include "support/file_stuff.h"
#include "support/module_fixture.h"

namespace {

using rktest::TestStuffPtr;

class IdentityTest : public rktest::ModuleTest {
 protected:
  static void DeleteCacheFile(RK_Stuff& item) {
    ASSERT_EQ(item.Checkout(RK_Checkout_ReadOnly | RK_Checkout_EvenIfNotInMemory),
              RK_CheckoutResult_CheckedOut);
    item.ConvertToWriteable();
    item.Checkin(RK_Checkin_KeepLastUse, {});
  }
  TestStuffPtr WithFile(TestStuffPtr item, std::size_t bytes) {
    RK_TEST_Access::SetDiskCacheFile(
        *item, rktest::WriteFile(folder, item->Name() + ".vxcache", rktest::CountingBytes(bytes)));
    return item;
  }
  TestStuffPtr EnterWithFile(const std::string& name, std::size_t bytes) {
    return WithFile(Enter(Make(name, static_cast<std::uint32_t>(bytes))), bytes);
  }

  rktest::TempDir folder;
};

TEST_F(IdentityTest, GetDiskCacheFileCopiesTheFileOrGivesAnEmptyOne) {
  TestStuffPtr item = EnterWithFile("a", 10);
  EXPECT_EQ(item->GetDiskCacheFile().FullPath(), plinth::utility::UTF8to16(folder.Path() + "/a.vxcache"));
  item->SetOnDisk(false);  // the virtual decides
  EXPECT_TRUE(item->GetDiskCacheFile().IsEmpty());
}

TEST_F(IdentityTest, DeletionRemovesTheFileUnchargesItsSizeAndCountsAChange) {
  TestStuffPtr item = EnterWithFile("a", 4096);
  RK_TEST_Access::SetDiskCacheSize(*bag, 10000);
  const plinth::filesupport::File file = item->GetDiskCacheFile();
  const auto changes = dir->GetLastChangeTime();
  DeleteCacheFile(*item);
  EXPECT_FALSE(file.Exists());
  EXPECT_FALSE(item->IsOnDisk());
  EXPECT_EQ(bag->GetCurrentDiskCacheSize(), 10000 - 4096);
  EXPECT_EQ(dir->GetLastChangeTime(), changes + 3);  // leaving, the deletion, coming back
  // Nothing left to delete: the deletion changes nothing.
  DeleteCacheFile(*item);
  EXPECT_EQ(bag->GetCurrentDiskCacheSize(), 10000 - 4096);
  EXPECT_EQ(dir->GetLastChangeTime(), changes + 5);
  EXPECT_EQ(journal->Events(), std::vector<std::string>{"a:YourDiskCacheFileWasDeleted"});
}

TEST_F(IdentityTest, OnlyTheMainThreadNotifiesTheItem) {
  TestStuffPtr a = EnterWithFile("a", 100);
  TestStuffPtr b = EnterWithFile("b", 100);
  RK_TEST_Access::SetDiskCacheSize(*bag, 200);
  for (bool render : {true, false}) rktest::OnThread(render, [&] { DeleteCacheFile(render ? *a : *b); });
  EXPECT_FALSE(a->IsOnDisk() || b->IsOnDisk());
  EXPECT_EQ(bag->GetCurrentDiskCacheSize(), 0);
  EXPECT_TRUE(journal->Events().empty());
}

TEST_F(IdentityTest, FailuresToMeasureOrDeleteAreSwallowedAndAnOrphanedItemStillLosesItsFile) {
  // The file vanished behind the module's back: the item loses its link and
  // nothing is un-charged.
  TestStuffPtr a = EnterWithFile("a", 100);
  RK_TEST_Access::SetDiskCacheSize(*bag, 500);
  a->GetDiskCacheFile().Delete();
  DeleteCacheFile(*a);
  EXPECT_FALSE(a->IsOnDisk());
  EXPECT_EQ(bag->GetCurrentDiskCacheSize(), 500);
  EXPECT_TRUE(rkhost::control::Snapshot().exceptions.empty());

  // An item whose bag is gone still has its file deleted.
  TestStuffPtr orphan = Make("o", 10);
  boost::shared_ptr<RK_Bag>(new RK_Bag)->AddStuff(orphan);
  const plinth::filesupport::File orphanFile = WithFile(orphan, 10)->GetDiskCacheFile();
  DeleteCacheFile(*orphan);
  EXPECT_FALSE(orphanFile.Exists());
  EXPECT_EQ(bag->GetCurrentDiskCacheSize(), 500);
}

}  // namespace
