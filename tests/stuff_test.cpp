// RK_Stuff: a new item's fields, the base class's answers, reference
// counting, and the check-out state checks.
#include <gtest/gtest.h>

#include <atomic>
#include <set>
#include <thread>
#include <vector>

#include "host/control.h"
#include "rkcache/rkcache.h"
#include "support/test_access.h"

namespace ctl = rkhost::control;

namespace {

// Implements only what every subclass must, so the base answers show.
class BareStuff : public RK_Stuff {
 public:
  std::uint32_t GetSizeInBytes() override { return 10; }
  bool FreeMemory() override { return false; }
  bool IsInMemory() override { return true; }

 protected:
  ~BareStuff() override = default;
};

// Counts its destructions; its destructor takes and drops a temporary
// reference to itself, as subclasses that notify observers do.
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

template <class F>
int ThrownCode(F&& f) {
  try {
    f();
  } catch (int code) {
    return code;
  }
  return -1;
}

}  // namespace

TEST(Stuff, NewItemHasItsInitialState) {
  const boost::posix_time::ptime before = RK_Now();
  boost::intrusive_ptr<RK_Stuff> item(new BareStuff);
  const boost::posix_time::ptime after = RK_Now();

  EXPECT_FALSE(item->GetGuid().IsNil());
  EXPECT_EQ(item->GetCheckoutCount(), 0u);
  EXPECT_FALSE(item->IsCheckedOutWriteable());
  EXPECT_FALSE(item->IsOnDisk());
  EXPECT_FALSE(item->GetBag());
  EXPECT_FALSE(item->GetSortDir());
  EXPECT_FALSE(item->GetNoDiskCache());
  EXPECT_LE(before, item->GetLastUseTime());
  EXPECT_LE(item->GetLastUseTime(), after);
  EXPECT_EQ(item->RefCountForDiagnostics(), 1u);

  // Every item gets a GUID of its own.
  std::set<plinth::utility::Guid> guids{item->GetGuid()};
  std::vector<boost::intrusive_ptr<RK_Stuff>> more;
  for (int i = 0; i < 100; ++i) {
    more.emplace_back(new BareStuff);
    guids.insert(more.back()->GetGuid());
  }
  EXPECT_EQ(guids.size(), 101u);

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
  item->SetNoDiskCache();
  EXPECT_TRUE(item->GetNoDiskCache());
}

TEST(Stuff, LastReleaseDeletesExactlyOnce) {
  std::atomic<int> deaths{0};
  {
    boost::intrusive_ptr<RK_Stuff> first(new CountedStuff(&deaths));
    boost::intrusive_ptr<RK_Stuff> second = first;
    EXPECT_EQ(first->RefCountForDiagnostics(), 2u);
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

TEST(Stuff, GetBagIsEmptyOnceTheBagIsGone) {
  boost::intrusive_ptr<RK_Stuff> item(new BareStuff);
  boost::shared_ptr<RK_Bag> bag(new RK_Bag());
  bag->AddStuff(item);
  EXPECT_EQ(item->GetBag(), bag);
  bag.reset();
  EXPECT_FALSE(item->GetBag());
}

TEST(Stuff, CheckoutChecksCompareUnsignedAndReportTheirMessage) {
  boost::intrusive_ptr<RK_Stuff> item(new BareStuff);

  // Less than: nobody holds it.
  EXPECT_EQ(ThrownCode([&] { RK_TEST_Access::ThrowIfCheckedOutLessThan(*item, 1); }), 0x3A04);
  EXPECT_NO_THROW(RK_TEST_Access::ThrowIfCheckedOutLessThan(*item, 0));
  RK_TEST_Access::SetCheckoutCount(*item, 3);
  EXPECT_NO_THROW(RK_TEST_Access::ThrowIfCheckedOutLessThan(*item, 3));
  EXPECT_EQ(ThrownCode([&] { RK_TEST_Access::ThrowIfCheckedOutLessThan(*item, 4); }), 0x3A04);
  // -1 compares as the largest count.
  EXPECT_EQ(ThrownCode([&] { RK_TEST_Access::ThrowIfCheckedOutLessThan(*item, -1); }), 0x3A04);

  // More than.
  RK_TEST_Access::SetCheckoutCount(*item, 1);
  EXPECT_EQ(ThrownCode([&] { RK_TEST_Access::ThrowIfCheckedOutMoreThan(*item, 0); }), 0x3A03);
  EXPECT_NO_THROW(RK_TEST_Access::ThrowIfCheckedOutMoreThan(*item, 1));
  RK_TEST_Access::SetCheckoutCount(*item, 0xFFFFFFFFu);
  EXPECT_NO_THROW(RK_TEST_Access::ThrowIfCheckedOutMoreThan(*item, -1));

  // Writeable.
  RK_TEST_Access::SetCheckoutCount(*item, 1);
  EXPECT_NO_THROW(RK_TEST_Access::ThrowIfCheckedOutWriteable(*item));
  RK_TEST_Access::SetCheckedOutWriteable(*item, true);
  ctl::ClearCaptured();
  EXPECT_EQ(ThrownCode([&] { RK_TEST_Access::ThrowIfCheckedOutWriteable(*item); }), 0x3A03);
  const ctl::Captured captured = ctl::Snapshot();
  ASSERT_EQ(captured.errorReports.size(), 1u);
  EXPECT_EQ(captured.errorReports[0].group, 0x3A0000);
  EXPECT_EQ(captured.errorReports[0].number, 2);
  EXPECT_EQ(captured.errorReports[0].detail, "cached item already checked-out read/write");

  // A render thread gets the code without a report.
  ctl::ClearCaptured();
  int code = 0;
  std::thread([&] {
    ctl::SetCurrentThreadIsRenderThread(true);
    code = ThrownCode([&] { RK_TEST_Access::ThrowIfCheckedOutMoreThan(*item, 0); });
  }).join();
  EXPECT_EQ(code, 0x3A03);
  EXPECT_TRUE(ctl::Snapshot().errorReports.empty());

  RK_TEST_Access::SetCheckedOutWriteable(*item, false);
  RK_TEST_Access::SetCheckoutCount(*item, 0);
}
