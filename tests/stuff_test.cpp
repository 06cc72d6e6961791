// RK_Stuff: a new item's fields, the base class's answers, reference
// counting, and the check-out state checks.
#include <atomic>
#include <set>

#include "support/module_fixture.h"

namespace {

using rktest::ThrownCode;

// Implements only what every subclass must, so the base answers show.
class BareStuff : public RK_Stuff {
 public:
  std::uint32_t GetSizeInBytes() override { return 10; }
  bool FreeMemory() override { return false; }
  bool IsInMemory() override { return true; }

 protected:
  ~BareStuff() override = default;
};

// Counts its deaths; its destructor takes a temporary reference to itself,
// as subclasses that notify observers do.
class CountedStuff : public BareStuff {
 public:
  explicit CountedStuff(std::atomic<int>* deaths) : deaths_(deaths) {}

 protected:
  ~CountedStuff() override {
    { boost::intrusive_ptr<RK_Stuff> temporary(this); }
    ++*deaths_;
  }

 private:
  std::atomic<int>* deaths_;
};

}  // namespace

TEST(Stuff, NewItemHasItsInitialStateAndItsOwnGuid) {
  const boost::posix_time::ptime before = RK_Now();
  boost::intrusive_ptr<RK_Stuff> item(new BareStuff);
  EXPECT_EQ(item->GetCheckoutCount(), 0u);
  EXPECT_FALSE(item->IsCheckedOutWriteable());
  EXPECT_FALSE(item->IsOnDisk() || item->GetBag() || item->GetSortDir() || item->GetNoDiskCache());
  EXPECT_LE(before, item->GetLastUseTime());
  EXPECT_LE(item->GetLastUseTime(), RK_Now());
  EXPECT_EQ(item->RefCountForDiagnostics(), 1u);

  std::set<plinth::utility::Guid> guids{item->GetGuid()};
  std::vector<boost::intrusive_ptr<RK_Stuff>> more;
  for (int i = 0; i < 100; ++i) {
    more.emplace_back(new BareStuff);
    guids.insert(more.back()->GetGuid());
  }
  EXPECT_EQ(guids.size(), 101u);
  EXPECT_EQ(guids.count(plinth::utility::Guid()), 0u);
  const plinth::utility::Guid chosen(0x1234, 0x5678);
  item->SetGuid(chosen);
  EXPECT_EQ(item->GetGuid(), chosen);
}

TEST(Stuff, BaseClassAnswers) {
  boost::intrusive_ptr<RK_Stuff> item(new BareStuff);
  boost::intrusive_ptr<RK_Stuff> request(new BareStuff);
  EXPECT_TRUE(item->IdenticalRequest(request.get()));
  EXPECT_TRUE(item->CanSatisfyRequest(request.get()));
  EXPECT_FALSE(item->CanDiskCache());
  EXPECT_EQ(item->GetSubclassMatchname(), nullptr);
  RK_HeaderBytes header{1, 2, 3};
  item->GetHeader(header);
  EXPECT_EQ(header, (RK_HeaderBytes{1, 2, 3}));
  // On disk exactly while it has a cache file.
  RK_TEST_Access::SetDiskCacheFile(
      *item, boost::shared_ptr<plinth::filesupport::File>(new plinth::filesupport::File()));
  EXPECT_TRUE(item->IsOnDisk());
  RK_TEST_Access::SetDiskCacheFile(*item, nullptr);
  EXPECT_FALSE(item->IsOnDisk());
  item->SetNoDiskCache();
  EXPECT_TRUE(item->GetNoDiskCache());
}

TEST(Stuff, LastReleaseDeletesExactlyOnce) {
  std::atomic<int> deaths{0};
  {
    boost::intrusive_ptr<RK_Stuff> first(new CountedStuff(&deaths));
    boost::intrusive_ptr<RK_Stuff> second = first;
    first.reset();
    EXPECT_EQ(deaths.load(), 0);
  }
  EXPECT_EQ(deaths.load(), 1);

  // References dropped on several threads at once: still one deletion.
  deaths = 0;
  {
    boost::intrusive_ptr<RK_Stuff> item(new CountedStuff(&deaths));
    std::vector<std::thread> threads;
    for (int t = 0; t < 4; ++t) {
      threads.emplace_back([copy = item]() mutable {
        for (int i = 0; i < 1000; ++i) boost::intrusive_ptr<RK_Stuff> again = copy;
        copy.reset();
      });
    }
    item.reset();
    for (std::thread& t : threads) t.join();
  }
  EXPECT_EQ(deaths.load(), 1);
}

TEST(Stuff, CheckoutChecksCompareUnsigned) {
  rkhost::control::MakeCurrentThreadMain();
  boost::intrusive_ptr<RK_Stuff> item(new BareStuff);
  const struct {
    std::uint32_t count;
    bool lessThan;  // else moreThan
    int n, code;
  } cases[] = {
      {0, true, 1, 0x3A04},  {0, true, 0, -1},      {3, true, 3, -1},
      {3, true, 4, 0x3A04},  {3, true, -1, 0x3A04},  // -1 compares as the largest count
      {1, false, 0, 0x3A03}, {1, false, 1, -1},     {0xFFFFFFFFu, false, -1, -1},
  };
  for (const auto& c : cases) {
    RK_TEST_Access::SetCheckoutCount(*item, c.count);
    EXPECT_EQ(ThrownCode([&] {
                c.lessThan ? RK_TEST_Access::ThrowIfCheckedOutLessThan(*item, c.n)
                           : RK_TEST_Access::ThrowIfCheckedOutMoreThan(*item, c.n);
              }),
              c.code)
        << "count " << c.count << (c.lessThan ? " < " : " > ") << c.n;
  }
  RK_TEST_Access::SetCheckoutCount(*item, 1);
  rkhost::control::ClearCaptured();
  EXPECT_EQ(ThrownCode([&] { RK_TEST_Access::ThrowIfCheckedOutWriteable(*item); }), -1);
  RK_TEST_Access::SetCheckedOutWriteable(*item, true);
  EXPECT_EQ(ThrownCode([&] { RK_TEST_Access::ThrowIfCheckedOutWriteable(*item); }), 0x3A03);
  EXPECT_EQ(rktest::ReportDetails(), std::vector<std::string>{"cached item already checked-out read/write"});
  RK_TEST_Access::SetCheckedOutWriteable(*item, false);
  RK_TEST_Access::SetCheckoutCount(*item, 0);
}
