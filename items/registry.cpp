// The subclass factory registry: match name (UTF-16, compared code unit by
// code unit) to the factory that builds an empty item from header bytes.
//
// Absent until the first registration and again after RK_Stuff::Death or
// RK_Death. It takes no lock: registrations are complete before any disk
// cache scan runs, and Death never overlaps a scan.
#include <memory>

#include "host/hk.h"
#include "rkcache/stuff.h"

RK_FactoryMap* RK_Stuff::S_factory_funcsP = nullptr;

void RK_Stuff::RegisterFactory(const char* matchName, const RK_Factory& factory) {
  if (!S_factory_funcsP) S_factory_funcsP = new RK_FactoryMap;
  // A second registration under a name replaces the first, silently.
  (*S_factory_funcsP)[HK_AsciiToUTF16String(matchName)] = factory;
}

boost::intrusive_ptr<RK_Stuff> RK_Stuff::CreateSubclass(const char* matchName, const RK_HeaderBytes& header) {
  if (!S_factory_funcsP) return nullptr;
  const auto entry = S_factory_funcsP->find(HK_AsciiToUTF16String(matchName));
  if (entry == S_factory_funcsP->end() || !entry->second) return nullptr;
  // An exception from the factory is the caller's (the scan deletes the file).
  return entry->second(header);
}

void RK_Stuff::Death() {
  // Detach first, so a factory whose destruction re-enters the registry
  // finds it absent rather than half destroyed.
  std::unique_ptr<RK_FactoryMap> registry(S_factory_funcsP);
  S_factory_funcsP = nullptr;
}
