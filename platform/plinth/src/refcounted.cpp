#include "plinth/refcounted.h"

namespace plinth {
namespace utility {

RefCountedObject::~RefCountedObject() = default;

void RefCountedObject::AddRef() const {
  refCount.fetch_add(1, std::memory_order_relaxed);
}

void RefCountedObject::Release() const {
  // acq_rel: the deleting thread must see every write made by the threads
  // that released before it.
  if (refCount.fetch_sub(1, std::memory_order_acq_rel) != 1) return;
  // A destructor that takes and drops a temporary reference brings the
  // count from 1 to 0 again; beingDeleted keeps that from deleting twice.
  if (beingDeleted) return;
  beingDeleted = true;
  delete this;
}

}  // namespace utility
}  // namespace plinth
