#include "Statistics/Service/OstrelReportingServiceMain.h"

#include "Statistics/Service/OstrelReportingServiceDelegate.h"

namespace ostrel {

int OstrelReportingServiceMain(const OstrelReportingPlatform& platform,
                               IPCListener& listener) {
  const auto root = OstrelReportingServiceDelegate::init(platform);
  listener.setDelegate(root.get());
  listener.resume();
  listener.setDelegate(nullptr);
  return 0;
}

}  // namespace ostrel
