// The platform library: everything in one include.
#pragma once

#include "plinth/allocator.h"
#include "plinth/config.h"
#include "plinth/debug.h"
#include "plinth/files.h"
#include "plinth/guid.h"
#include "plinth/native.h"
#include "plinth/refcounted.h"
#include "plinth/streams.h"
#include "plinth/text.h"
#include "plinth/threads.h"
#include "plinth/types.h"
#include "plinthview/ui.h"
