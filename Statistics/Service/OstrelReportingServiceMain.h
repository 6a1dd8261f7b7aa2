#pragma once

#include "platform/IPCListener.h"
#include "platform/OstrelReportingPlatform.h"

namespace ostrel {

/// Runs the service: makes the root object and serves `listener`'s clients on
/// the calling thread until the listener returns. Returns the exit status, 0.
int OstrelReportingServiceMain(const OstrelReportingPlatform& platform,
                               IPCListener& listener);

}  // namespace ostrel
