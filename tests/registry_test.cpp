// The subclass factory registry: registration and replacement, exact names,
// header bytes passed unchanged, and discarding by RK_Stuff::Death and RK_Death.
#include <gtest/gtest.h>

#include <boost/make_shared.hpp>
#include <stdexcept>
#include <string>
#include <vector>

#include "rkcache/rkcache.h"
#include "support/module_fixture.h"

namespace {

// A factory that records the headers it was given and tags what it builds.
struct RecordingFactory {
  std::string tag;
  boost::shared_ptr<std::vector<RK_HeaderBytes>> headers = boost::make_shared<std::vector<RK_HeaderBytes>>();

  boost::intrusive_ptr<RK_Stuff> operator()(const RK_HeaderBytes& header) const {
    headers->push_back(header);
    return rktest::TestStuff::Make(1000, true, false, nullptr, tag);
  }
};

std::string TagOf(const boost::intrusive_ptr<RK_Stuff>& item) {
  auto* test = dynamic_cast<rktest::TestStuff*>(item.get());
  return test ? test->Name() : std::string("<none>");
}

boost::intrusive_ptr<RK_Stuff> Create(const char* name, const RK_HeaderBytes& header = {}) {
  return RK_TEST_Access::CreateSubclass(name, header);
}

}  // namespace

TEST(Registry, AbsentUntilTheFirstRegistration) {
  EXPECT_FALSE(Create("Frame"));
  RK_Birth(false);
  EXPECT_EQ(RK_TEST_Access::FactoryRegistry(), nullptr);  // neither a lookup nor birth makes one
  RK_StopAllAsyncWork();
  RK_Death();
}

TEST(Registry, LaterRegistrationReplacesNamesMatchExactlyAndHeadersPassUnchanged) {
  RecordingFactory first{"first"};
  RecordingFactory second{"second"};
  RK_Stuff::RegisterFactory("Frame", first);
  RK_Stuff::RegisterFactory("Frame", second);
  RK_HeaderBytes bytes;
  for (int i = 0; i < 300; ++i) bytes.push_back(static_cast<unsigned char>(i * 7));
  EXPECT_EQ(TagOf(Create("Frame", bytes)), "second");
  EXPECT_TRUE(first.headers->empty());
  EXPECT_EQ(*second.headers, std::vector<RK_HeaderBytes>{bytes});
  EXPECT_FALSE(Create("frame"));
  EXPECT_FALSE(Create("Fram"));
  RK_Stuff::Death();
}

TEST(Registry, EmptyOrNullFactoriesYieldNullAndFactoryErrorsPassThrough) {
  RK_Stuff::RegisterFactory("Empty", RK_Factory());
  EXPECT_FALSE(Create("Empty"));
  RK_Stuff::RegisterFactory("Null", [](const RK_HeaderBytes&) { return boost::intrusive_ptr<RK_Stuff>(); });
  EXPECT_FALSE(Create("Null"));
  RK_Stuff::RegisterFactory("Rejects", [](const RK_HeaderBytes& header) -> boost::intrusive_ptr<RK_Stuff> {
    if (header.empty()) throw std::invalid_argument("empty header");
    throw 0x3A07;
  });
  EXPECT_THROW(Create("Rejects"), std::invalid_argument);
  EXPECT_EQ(rktest::ThrownCode([] { Create("Rejects", RK_HeaderBytes{1}); }), 0x3A07);
  RK_Stuff::Death();
}

TEST(Registry, DeathDiscardsTheCopiesAndRegistrationStartsAfresh) {
  RecordingFactory factory{"old"};
  RK_Stuff::RegisterFactory("Frame", factory);
  RK_Stuff::RegisterFactory("Other", factory);
  EXPECT_EQ(factory.headers.use_count(), 3);  // the registry holds copies of its own
  RK_Stuff::Death();
  EXPECT_EQ(RK_TEST_Access::FactoryRegistry(), nullptr);
  EXPECT_EQ(factory.headers.use_count(), 1);
  RK_Stuff::Death();  // a second discard finds nothing to do

  RecordingFactory fresh{"fresh"};
  RK_Stuff::RegisterFactory("Frame", fresh);
  EXPECT_EQ(TagOf(Create("Frame")), "fresh");
  EXPECT_FALSE(Create("Other"));

  // Module shut-down discards it the same way.
  RK_Birth(false);
  RK_StopAllAsyncWork();
  RK_Death();
  EXPECT_EQ(RK_TEST_Access::FactoryRegistry(), nullptr);
  EXPECT_EQ(fresh.headers.use_count(), 1);
}
