#include <ostrel/OstrelReportingClient.h>

using namespace ostrel::reporting;

int main() {
  Client client;
  const ReporterID session{4711};
  client.createReportingSession(session);
  client.setServiceType(ServiceType{2}, session);
  client.startReportingSessionForID(session);
  client.sendMessage({{"route", "Speaker"}}, Category{0x40000007}, MessageType{0},
                     {{session}});
  client.stopReportingSessionForID(session);
  return client.flush(std::chrono::seconds(2)) ? 0 : 1;
}
