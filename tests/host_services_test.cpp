// Thread identity, error reports, quiet errors, verifications, exceptions
// and the logger of the host services.
#include <gtest/gtest.h>

#include <algorithm>
#include <iterator>
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

int CountLines(const ctl::Captured& c, const std::string& tag) {
  int n = 0;
  for (const ctl::LogLine& line : c.logLines) n += line.tag == tag ? 1 : 0;
  return n;
}

TEST_F(HostServices, MainThreadIsTheInitialOneAndTheRenderMarkIsPerThread) {
  // The test body runs on the thread that loaded the library.
  EXPECT_TRUE(HK_IsOnMainThread());
  EXPECT_FALSE(HK_IsOnRenderThread());
  bool otherIsMain = true, marked = false, freshThreadMarked = true, unmarked = true;
  OnOtherThread([&] {
    otherIsMain = HK_IsOnMainThread();
    ctl::SetCurrentThreadIsRenderThread(true);
    marked = HK_IsOnRenderThread();
    OnOtherThread([&] { freshThreadMarked = HK_IsOnRenderThread(); });
    ctl::SetCurrentThreadIsRenderThread(false);
    unmarked = HK_IsOnRenderThread();
  });
  EXPECT_FALSE(otherIsMain);
  EXPECT_TRUE(marked);
  EXPECT_FALSE(freshThreadMarked);
  EXPECT_FALSE(unmarked);
  EXPECT_FALSE(HK_IsOnRenderThread());

  // The host may name another thread the main one.
  bool mainAfterMove = false;
  OnOtherThread([&] {
    ctl::MakeCurrentThreadMain();
    mainAfterMove = HK_IsOnMainThread();
  });
  EXPECT_TRUE(mainAfterMove);
  EXPECT_FALSE(HK_IsOnMainThread());
  ctl::MakeCurrentThreadMain();
  EXPECT_TRUE(HK_IsOnMainThread());
}

TEST_F(HostServices, ReportsAreCapturedExactlyAndSuppressedOnlyOnTheQuietThread) {
  HKp_ReportErrString(0x3A0000, 2, "internal structure damaged");
  ASSERT_EQ(0, HK_StartQuietErrorsOnCurrentThread(true));
  bool otherQuiet = true;
  OnOtherThread([&] {
    otherQuiet = HK_AreErrorsQuietOnCurrentThread();
    HKp_ReportErrString(0x3A0000, 9, "from the other thread");
  });
  HKp_ReportErrString(0x3A0000, 8, "cannot resize or move disk cache");
  HK_EndQuietErrorsOnCurrentThread();
  HKp_ReportErrString(0x3A0000, 2, nullptr);
  EXPECT_FALSE(otherQuiet);

  const ctl::Captured c = ctl::Snapshot();
  const struct {
    int number;
    const char* detail;
    bool suppressed;
  } expected[] = {{2, "internal structure damaged", false},
                  {9, "from the other thread", false},
                  {8, "cannot resize or move disk cache", true},
                  {2, "", false}};
  ASSERT_EQ(std::size(expected), c.errorReports.size());
  for (std::size_t i = 0; i < std::size(expected); ++i) {
    EXPECT_EQ(0x3A0000, c.errorReports[i].group) << i;
    EXPECT_EQ(expected[i].number, c.errorReports[i].number) << i;
    EXPECT_EQ(expected[i].detail, c.errorReports[i].detail) << i;
    EXPECT_EQ(expected[i].suppressed, c.errorReports[i].suppressed) << i;
  }
  // Shown reports and suppressed ones reach the log under different tags.
  EXPECT_EQ(3, CountLines(c, "Error"));
  EXPECT_EQ(1, CountLines(c, "SuppressedError"));

  ctl::ClearCaptured();
  EXPECT_TRUE(ctl::Snapshot().errorReports.empty());
  EXPECT_TRUE(ctl::Snapshot().logLines.empty());
}

TEST_F(HostServices, QuietErrorsNestAndOnlyBalancedBracketsCount) {
  EXPECT_FALSE(HK_AreErrorsQuietOnCurrentThread());
  ASSERT_EQ(0, HK_StartQuietErrorsOnCurrentThread(true));
  ASSERT_EQ(0, HK_StartQuietErrorsOnCurrentThread(true));
  HK_EndQuietErrorsOnCurrentThread();
  EXPECT_TRUE(HK_AreErrorsQuietOnCurrentThread());
  ASSERT_EQ(0, HK_StartQuietErrorsOnCurrentThread(false));  // the innermost bracket decides
  EXPECT_FALSE(HK_AreErrorsQuietOnCurrentThread());
  HK_EndQuietErrorsOnCurrentThread();
  EXPECT_TRUE(HK_AreErrorsQuietOnCurrentThread());
  HK_EndQuietErrorsOnCurrentThread();
  EXPECT_FALSE(HK_AreErrorsQuietOnCurrentThread());

  // An end without a start is logged and changes nothing.
  HK_EndQuietErrorsOnCurrentThread();
  EXPECT_FALSE(HK_AreErrorsQuietOnCurrentThread());
  EXPECT_EQ(1, CountLines(ctl::Snapshot(), "QuietErrors"));

  // A failed start opens no bracket and owes no end.
  ctl::FailStartQuietErrors(0x1234);
  EXPECT_EQ(0x1234, HK_StartQuietErrorsOnCurrentThread(true));
  EXPECT_FALSE(HK_AreErrorsQuietOnCurrentThread());
  ctl::FailStartQuietErrors(0);
  ASSERT_EQ(0, HK_StartQuietErrorsOnCurrentThread(true));
  EXPECT_TRUE(HK_AreErrorsQuietOnCurrentThread());
  HK_EndQuietErrorsOnCurrentThread();
  EXPECT_FALSE(HK_AreErrorsQuietOnCurrentThread());
  EXPECT_EQ(1, CountLines(ctl::Snapshot(), "QuietErrors"));
}

TEST_F(HostServices, VerificationsAreRecordedAndLogged) {
  HK_ReportFailedVerification(nullptr, 380, nullptr, "stuff already in a bag");
  HK_ReportFailedVerification("bag.cpp", 402, "bag == this", "stuff not in the right bag");
  const ctl::Captured c = ctl::Snapshot();
  ASSERT_EQ(2u, c.verifications.size());
  EXPECT_EQ(380, c.verifications[0].number);
  EXPECT_EQ("stuff already in a bag", c.verifications[0].message);
  EXPECT_EQ(402, c.verifications[1].number);
  EXPECT_EQ("stuff not in the right bag", c.verifications[1].message);
  ASSERT_EQ(2, CountLines(c, "Verification"));
  EXPECT_EQ("failed verification 402: stuff not in the right bag (bag == this) in bag.cpp",
            c.logLines[1].text);
  EXPECT_TRUE(c.errorReports.empty());
}

TEST_F(HostServices, ExceptionsMapToCodesAndFollowQuietness) {
  EXPECT_EQ(HK_ErrOutOfMemory, HK_TranslateAndReportException(std::bad_alloc()));
  EXPECT_EQ(HK_ErrOutOfMemory, HK_TranslateAndReportException(std::bad_array_new_length()));
  ASSERT_EQ(0, HK_StartQuietErrorsOnCurrentThread(true));
  EXPECT_EQ(HK_ErrException, HK_TranslateAndReportException(std::runtime_error("disk full")));
  HK_EndQuietErrorsOnCurrentThread();
  EXPECT_EQ(HK_ErrException, HK_TranslateAndReportException(std::logic_error("bad state")));

  const ctl::Captured c = ctl::Snapshot();
  ASSERT_EQ(4u, c.exceptions.size());
  EXPECT_EQ(std::bad_alloc().what(), c.exceptions[0]);
  EXPECT_EQ("disk full", c.exceptions[2]);
  ASSERT_EQ(4u, c.exceptionReports.size());
  EXPECT_EQ(HK_ErrOutOfMemory, c.exceptionReports[1].code);
  EXPECT_FALSE(c.exceptionReports[1].suppressed);
  EXPECT_EQ(HK_ErrException, c.exceptionReports[2].code);
  EXPECT_TRUE(c.exceptionReports[2].suppressed);
  EXPECT_FALSE(c.exceptionReports[3].suppressed);
  EXPECT_EQ(1, CountLines(c, "SuppressedException"));
  EXPECT_EQ(3, CountLines(c, "Exception"));
}

TEST_F(HostServices, LogWritesThroughOneSinkWithALevelFilter) {
  std::vector<std::string> written;
  ctl::SetLogSink([&](const std::string& line) { written.push_back(line); });
  ctl::SetLogLevel(5);
  JOT_Log(5, "RK", "Birth", "RK Birth");
  JOT_Log(6, "RK", "Noise", "filtered out");
  JOT_sprintf(0, "RK", "PURGE_STATS", "numFreed:%d, numWalked:%d, Total: %d", 3, 7, 12);

  ASSERT_EQ(2u, written.size());
  const std::string birth = " L5 RK Birth: RK Birth";
  ASSERT_GE(written[0].size(), birth.size());
  EXPECT_EQ(birth, written[0].substr(written[0].size() - birth.size()));
  EXPECT_NE(std::string::npos, written[1].find(" L0 RK PURGE_STATS: numFreed:3, numWalked:7, Total: 12"));

  // Every line is captured, filtered or not, in order.
  const ctl::Captured c = ctl::Snapshot();
  ASSERT_EQ(3u, c.logLines.size());
  EXPECT_EQ(6, c.logLines[1].level);
  EXPECT_EQ("RK", c.logLines[1].module);
  EXPECT_EQ("Noise", c.logLines[1].tag);
  EXPECT_EQ("filtered out", c.logLines[1].text);
  EXPECT_EQ("numFreed:3, numWalked:7, Total: 12", c.logLines[2].text);

  // A shown report passes a strict filter; a suppressed one does not.
  ctl::SetLogLevel(1);
  written.clear();
  HKp_ReportErrString(0x3A0000, 2, "shown");
  ASSERT_EQ(0, HK_StartQuietErrorsOnCurrentThread(true));
  HKp_ReportErrString(0x3A0000, 2, "hidden");
  HK_EndQuietErrorsOnCurrentThread();
  ASSERT_EQ(1u, written.size());
  EXPECT_NE(std::string::npos, written[0].find("group 0x3A0000 number 2: shown"));

  // A sink that throws does not make the caller fail.
  ctl::SetLogSink([](const std::string&) { throw std::runtime_error("sink broken"); });
  EXPECT_NO_THROW(JOT_Log(0, "RK", "Tag", "still fine"));
}

TEST_F(HostServices, DefaultSinkWritesOneLineToStderr) {
  ::testing::internal::CaptureStderr();
  JOT_Log(10, "RK", "Death", "RK Death");
  JOT_Log(11, "RK", "Death", "too detailed");
  const std::string err = ::testing::internal::GetCapturedStderr();
  EXPECT_NE(std::string::npos, err.find(" L10 RK Death: RK Death\n"));
  EXPECT_EQ(std::string::npos, err.find("too detailed"));
  EXPECT_EQ(1, std::count(err.begin(), err.end(), '\n'));
}

TEST_F(HostServices, ConvertMesgPrefixesTheOperation) {
  EXPECT_EQ("RK_Stuff::EnsureInMemory: pre-prep", JOT_convertMesg("RK_Stuff::EnsureInMemory", "pre-prep"));
  EXPECT_EQ("Purge: 3 of 12 in D", JOT_convertMesg("Purge", "%d of %d in %s", 3, 12, "D"));
  const std::string longText(5000, 'x');
  EXPECT_EQ("Op: " + longText, JOT_convertMesg("Op", "%s", longText.c_str()));
}

}  // namespace
