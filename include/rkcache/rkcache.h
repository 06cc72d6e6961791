// The umbrella header: everything a host needs to use the cache module,
// together with the platform and host-service types that appear in its API.
#pragma once

#include "host/hk.h"
#include "plinth/plinth.h"
#include "rkcache/bag.h"
#include "rkcache/errors.h"
#include "rkcache/export.h"
#include "rkcache/lifecycle.h"
#include "rkcache/readahead.h"
#include "rkcache/receipt.h"
#include "rkcache/sortdir.h"
#include "rkcache/stuff.h"
#include "rkcache/types.h"
