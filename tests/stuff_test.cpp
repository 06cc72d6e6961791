// RK_Stuff: new items' GUIDs, reference counting, and the check-out state checks.
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

TEST(Stuff, EachNewItemHasItsOwnGuid) {
  std::set<plinth::utility::Guid> guids;
  std::vector<boost::intrusive_ptr<RK_Stuff>> items;
  for (int i = 0; i < 100; ++i) {
    items.emplace_back(new BareStuff);
    guids.insert(items.back()->GetGuid());
  }
  EXPECT_EQ(guids.size(), 100u);
  EXPECT_EQ(guids.count(plinth::utility::Guid()), 0u);
}

TEST(Stuff, LastReleaseDeletesExactlyOnce) {
  std::atomic<int> deaths{0};
  {
    boost::intrusive_ptr<RK_Stuff> item(new CountedStuff(&deaths));
    boost::intrusive_ptr<RK_Stuff>(item).reset();
    EXPECT_EQ(deaths.load(), 0);
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
      {3, true, 3, -1},      {3, true, 4, 0x3A04}, {3, true, -1, 0x3A04},  // -1 compares as the largest count
      {1, false, 0, 0x3A03}, {1, false, 1, -1},    {0xFFFFFFFFu, false, -1, -1},
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
  EXPECT_EQ(ThrownCode([&] { RK_TEST_Access::ThrowIfCheckedOutWriteable(*item); }), -1);
  RK_TEST_Access::SetCheckedOutWriteable(*item, true);
  EXPECT_EQ(ThrownCode([&] { RK_TEST_Access::ThrowIfCheckedOutWriteable(*item); }), 0x3A03);
  RK_TEST_Access::SetCheckedOutWriteable(*item, false);
  RK_TEST_Access::SetCheckoutCount(*item, 0);
}
