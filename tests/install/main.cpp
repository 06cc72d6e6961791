// A minimal host of the cache module: starts it, defines an item subclass
// with a factory, caches and finds an item, uses the read-ahead singleton,
// and shuts the module down. Exits non-zero on the first surprise.
#include <rkcache/rkcache.h>

#include <cstdio>
#include <string>
#include <vector>

namespace {

int failures = 0;

void Check(bool ok, const char* what) {
  if (!ok) {
    std::fprintf(stderr, "install host: %s\n", what);
    ++failures;
  }
}

// A computed result: a frame of `size` bytes identified by its number.
class HostFrame : public RK_Stuff {
 public:
  explicit HostFrame(int number) : number_(number) {}

  int Number() const { return number_; }

  bool IdenticalRequest(const RK_Stuff* request) const override {
    const auto* frame = dynamic_cast<const HostFrame*>(request);
    return frame && frame->number_ == number_;
  }
  std::uint32_t GetSizeInBytes() override { return 4096; }
  bool FreeMemory() override {
    const bool had = inMemory_;
    inMemory_ = false;
    return had;
  }
  bool IsInMemory() override { return inMemory_; }
  bool CanDiskCache() const override { return true; }
  const char* GetSubclassMatchname() const override { return "HostFrame"; }
  void GetHeader(RK_HeaderBytes& header) const override {
    header.push_back(static_cast<unsigned char>(number_));
  }

 private:
  ~HostFrame() override = default;

  int number_;
  bool inMemory_ = true;
};

}  // namespace

int main() {
  RK_Birth(false);
  boost::shared_ptr<RK_Bag> bag = RK_GlobalBag();
  Check(bag != nullptr && RK_GlobalSortDir() != nullptr, "globals after RK_Birth");

  RK_Stuff::RegisterFactory("HostFrame", [](const RK_HeaderBytes& header) -> boost::intrusive_ptr<RK_Stuff> {
    return boost::intrusive_ptr<RK_Stuff>(new HostFrame(header.empty() ? -1 : header[0]));
  });

  boost::intrusive_ptr<HostFrame> frame(new HostFrame(7));
  frame->AddToBagAndSortDir(bag, boost::posix_time::milliseconds(20));
  Check(bag->GetStuffCount() == 1, "item entered the bag");

  {
    boost::intrusive_ptr<HostFrame> request(new HostFrame(7));
    request->SetGuid(frame->GetGuid());
    RK_ScCheckout receipt;
    Check(receipt.FindAndCheckout(request.get(), RK_Checkout_ReadOnly) == RK_CheckoutResult_CheckedOut,
          "cached item found");
    Check(receipt.GetStuff() == frame.get(), "the cached item itself");
    Check(frame->GetCheckoutCount() == 1, "held by the receipt");
  }
  Check(frame->GetCheckoutCount() == 0, "checked in by the receipt");

  boost::shared_ptr<vx::rk::ReadAheadInfo> readAhead = vx::rk::ReadAheadInfo::Get();
  int cancelled = 0;
  readAhead->RegisterCancelOutstandingRequestsCallback(&cancelled, [&cancelled] { ++cancelled; });
  readAhead->SetReadAheadSkipInterval(3);
  readAhead->SetDoReadAhead(true);
  Check(!readAhead->DoReadAhead(), "no read-ahead off the render threads");
  readAhead->SetDoReadAhead(false);
  Check(cancelled == 1 && readAhead->GetReadAheadSkipInterval() == 1, "read-ahead switched off");
  readAhead->UnRegisterCancelOutstandingRequestsCallback(&cancelled);

  std::string text = HK_ZLookupLStrCache(RK_G_zref, 2, 0, 0);
  Check(text == "internal structure damaged", "message table");

  RK_StopAllAsyncWork();
  bag.reset();
  RK_Death();
  Check(!RK_GlobalBag(), "globals after RK_Death");
  Check(frame->GetBag() == nullptr, "item left its bag");

  if (failures == 0) std::printf("install host: ok\n");
  return failures == 0 ? 0 : 1;
}
