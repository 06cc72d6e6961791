// Starting background disk writes (internal).
#pragma once

#include <boost/intrusive_ptr.hpp>

class RK_Stuff;

// Submits a write job for the item to the background executor with no
// delay; the job holds a reference to the item until it has run. Returns
// false, submitting nothing, when there is no executor (after
// RK_StopAllAsyncWork).
bool RKp_QueueBackgroundWrite(const boost::intrusive_ptr<RK_Stuff>& stuff);
