// Thread marks, error reports, quiet errors, verifications, exceptions and
// the logger of the host services.
#include <gtest/gtest.h>

#include <new>
#include <stdexcept>
#include <string>
#include <thread>
#include <vector>

#include "host/control.h"
#include "host/hk.h"

namespace ctl = rkhost::control;

namespace {

class HostServices : public ::testing::Test {
 protected:
  void SetUp() override { ctl::ClearCaptured(); }
  void TearDown() override {
    ctl::FailStartQuietErrors(0);
    ctl::SetLogLevel(10);
    ctl::SetLogSink({});
    while (HK_AreErrorsQuietOnCurrentThread()) HK_EndQuietErrorsOnCurrentThread();
    ctl::ClearCaptured();
  }
};

// Runs fn on a new thread and waits for it.
template <class Fn>
void OnOtherThread(Fn fn) {
  std::thread t(fn);
  t.join();
}

TEST_F(HostServices, MainThreadIsTheInitialOneAndTheRenderMarkIsPerThread) {
  EXPECT_TRUE(HK_IsOnMainThread());  // the thread that loaded the library
  bool otherIsMain = true, marked = false, freshThreadMarked = true;
  OnOtherThread([&] {
    otherIsMain = HK_IsOnMainThread();
    ctl::SetCurrentThreadIsRenderThread(true);
    marked = HK_IsOnRenderThread();
    OnOtherThread([&] { freshThreadMarked = HK_IsOnRenderThread(); });
  });
  EXPECT_FALSE(otherIsMain);
  EXPECT_TRUE(marked);
  EXPECT_FALSE(freshThreadMarked);
  EXPECT_FALSE(HK_IsOnRenderThread());
}

TEST_F(HostServices, ReportsAreCapturedAndSuppressedOnlyOnTheQuietThread) {
  HKp_ReportErrString(0x3A0000, 2, "internal structure damaged");
  ASSERT_EQ(0, HK_StartQuietErrorsOnCurrentThread(true));
  OnOtherThread([] { HKp_ReportErrString(0x3A0000, 9, "from the other thread"); });
  HKp_ReportErrString(0x3A0000, 8, "cannot resize or move disk cache");
  HK_EndQuietErrorsOnCurrentThread();

  const ctl::Captured c = ctl::Snapshot();
  ASSERT_EQ(3u, c.errorReports.size());
  EXPECT_EQ(0x3A0000, c.errorReports[0].group);
  EXPECT_EQ("internal structure damaged", c.errorReports[0].detail);
  EXPECT_FALSE(c.errorReports[0].suppressed);
  EXPECT_EQ(9, c.errorReports[1].number);
  EXPECT_FALSE(c.errorReports[1].suppressed);
  EXPECT_EQ(8, c.errorReports[2].number);
  EXPECT_TRUE(c.errorReports[2].suppressed);
}

TEST_F(HostServices, QuietErrorsNestAndOnlyBalancedBracketsCount) {
  ASSERT_EQ(0, HK_StartQuietErrorsOnCurrentThread(true));
  ASSERT_EQ(0, HK_StartQuietErrorsOnCurrentThread(false));  // the innermost bracket decides
  EXPECT_FALSE(HK_AreErrorsQuietOnCurrentThread());
  HK_EndQuietErrorsOnCurrentThread();
  EXPECT_TRUE(HK_AreErrorsQuietOnCurrentThread());
  HK_EndQuietErrorsOnCurrentThread();
  EXPECT_FALSE(HK_AreErrorsQuietOnCurrentThread());

  HK_EndQuietErrorsOnCurrentThread();  // an end without a start changes nothing
  ASSERT_EQ(0, HK_StartQuietErrorsOnCurrentThread(true));
  EXPECT_TRUE(HK_AreErrorsQuietOnCurrentThread());
  HK_EndQuietErrorsOnCurrentThread();

  // A failed start opens no bracket and owes no end.
  ctl::FailStartQuietErrors(0x1234);
  EXPECT_EQ(0x1234, HK_StartQuietErrorsOnCurrentThread(true));
  EXPECT_FALSE(HK_AreErrorsQuietOnCurrentThread());
}

TEST_F(HostServices, VerificationsAndExceptionsAreRecorded) {
  HK_ReportFailedVerification(nullptr, 380, nullptr, "stuff already in a bag");
  EXPECT_EQ(HK_ErrOutOfMemory, HK_TranslateAndReportException(std::bad_alloc()));
  ASSERT_EQ(0, HK_StartQuietErrorsOnCurrentThread(true));
  EXPECT_EQ(HK_ErrException, HK_TranslateAndReportException(std::runtime_error("disk full")));
  HK_EndQuietErrorsOnCurrentThread();

  const ctl::Captured c = ctl::Snapshot();
  ASSERT_EQ(1u, c.verifications.size());
  EXPECT_EQ(380, c.verifications[0].number);
  EXPECT_EQ("stuff already in a bag", c.verifications[0].message);
  ASSERT_EQ(2u, c.exceptionReports.size());
  EXPECT_FALSE(c.exceptionReports[0].suppressed);
  EXPECT_TRUE(c.exceptionReports[1].suppressed);
  EXPECT_EQ(std::vector<std::string>({std::bad_alloc().what(), "disk full"}), c.exceptions);
}

TEST_F(HostServices, LogFiltersByLevelAndSurvivesABrokenSink) {
  std::vector<std::string> written;
  ctl::SetLogSink([&](const std::string& line) { written.push_back(line); });
  ctl::SetLogLevel(5);
  JOT_Log(5, "RK", "Birth", "RK Birth");
  JOT_sprintf(6, "RK", "Noise", "filtered %s", "out");
  ASSERT_EQ(1u, written.size());
  EXPECT_NE(std::string::npos, written[0].find(" L5 RK Birth: RK Birth"));
  EXPECT_EQ(2u, ctl::Snapshot().logLines.size());  // captured, filtered or not

  ctl::SetLogSink([](const std::string&) { throw std::runtime_error("sink broken"); });
  EXPECT_NO_THROW(JOT_Log(0, "RK", "Tag", "still fine"));
}

}  // namespace
