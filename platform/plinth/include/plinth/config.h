// The client (host application) version, set by the host.
#pragma once

#include "plinth/export.h"
#include "plinth/types.h"

namespace plinth {
namespace config {

// The host's internal version string; its leading number is the major
// version. Default "1.0" until the host sets it. Thread-safe.
PLINTH_API ustring GetClientInternalVersion();
PLINTH_API void SetClientInternalVersion(const ustring& version);

}  // namespace config
}  // namespace plinth
