// Intrusively reference-counted base classes.
//
// Ownership: whoever holds a reference (usually a boost::intrusive_ptr) keeps
// the object alive; the release that brings the count from 1 to 0 deletes it
// through its virtual destructor, exactly once: a destructor that takes and
// drops a temporary reference to its own object does not delete it again.
// Thread safety: AddRef and Release may be called on any thread.
#pragma once

#include <atomic>
#include <cstdint>

#include "plinth/export.h"

namespace plinth {
namespace utility {

class RefCountedInterface {
 public:
  virtual void AddRef() const = 0;
  virtual void Release() const = 0;

 protected:
  virtual ~RefCountedInterface() = default;
};

class PLINTH_API RefCountedObject : public virtual RefCountedInterface {
 public:
  void AddRef() const override;
  void Release() const override;

  // The current count; for diagnostics and tests only (it may change at once).
  std::uint32_t RefCountForDiagnostics() const { return refCount.load(std::memory_order_relaxed); }

 protected:
  RefCountedObject() = default;
  RefCountedObject(const RefCountedObject&) : RefCountedInterface() {}  // a copy starts unowned
  RefCountedObject& operator=(const RefCountedObject&) { return *this; }
  virtual ~RefCountedObject();

 private:
  mutable std::atomic<std::uint32_t> refCount{0};
  mutable bool beingDeleted = false;  // set once, by the release that deletes
};

inline void intrusive_ptr_add_ref(const RefCountedInterface* p) {
  p->AddRef();
}
inline void intrusive_ptr_release(const RefCountedInterface* p) {
  p->Release();
}

}  // namespace utility
}  // namespace plinth
