// The module is born on a main thread with nothing captured and dies after
// each test.
#pragma once

#include <gtest/gtest.h>

#include <boost/date_time/posix_time/posix_time.hpp>
#include <memory>
#include <string>
#include <thread>
#include <vector>

#include "host/control.h"
#include "rkcache/rkcache.h"
#include "support/test_access.h"
#include "support/test_stuff.h"

namespace rktest {

// The int f throws, or -1 if it throws nothing.
template <class F>
int ThrownCode(F&& f) {
  try {
    f();
  } catch (int code) {
    return code;
  }
  return -1;
}

using Verification = std::pair<int, std::string>;
std::vector<Verification> Verifications();
// The captured error reports' texts; each must carry group 0x3A0000, number 2.
std::vector<std::string> ReportDetails();
// Runs f on a new thread, marked as a render thread or not.
template <class F>
void OnThread(bool render, F&& f) {
  std::thread([&] {
    rkhost::control::SetCurrentThreadIsRenderThread(render);
    f();
  }).join();
}

class ModuleTest : public ::testing::Test {
 protected:
  void SetUp() override;
  void TearDown() override;

  template <class T>
  boost::intrusive_ptr<T> Enter(boost::intrusive_ptr<T> item,
                                const boost::posix_time::time_duration& computeTime = {}) {
    item->AddToBagAndSortDir(bag, computeTime);
    return item;
  }
  TestStuffPtr Make(const std::string& name, std::uint32_t size = 1000, bool inMemory = true,
                    bool track = false) const {
    return TestStuff::Make(size, inMemory, track, journal, name);
  }
  std::vector<RK_Stuff*> Order() const { return RK_TEST_Access::Order(*bag); }
  std::vector<RK_Stuff*> Group(const RK_Stuff& key) const { return RK_TEST_Access::Group(*dir, key); }
  bool Indexed(const RK_Stuff& item) const;

  boost::shared_ptr<RK_Bag> bag;
  boost::shared_ptr<RK_SortDir> dir;
  std::shared_ptr<Journal> journal = std::make_shared<Journal>();
};

}  // namespace rktest
