#include "benchmarks/wholepath/GrowthCurves.h"

#include <algorithm>
#include <array>
#include <cstdio>
#include <fstream>
#include <memory>
#include <utility>
#include <vector>

#include "benchmarks/wholepath/ServiceClient.h"

namespace ostrel::bench {
namespace {

constexpr std::int64_t kSession = 4711;
constexpr std::uint64_t kBurst = 250;
constexpr const char* kCostLabel = "processor time a message (ns)";

struct Curve {
  const char* name;
  const char* xLabel;
  const char* yLabel;
  std::vector<std::pair<double, double>> points;

  void add(double x, double y) {
    std::fprintf(stderr, "%s: %.0f: %.0f\n", name, x, y);
    points.emplace_back(x, y);
  }
};

Curve growWithClients(const Scale& scale) {
  Curve curve{"clients", "clients", kCostLabel, {}};
  for (std::int64_t count = 1; count <= scale.clients; count *= 10) {
    ServiceProcess service({.kind = ServiceKind::kCounting});
    std::vector<std::unique_ptr<ServiceClient>> clients;
    for (std::int64_t i = 0; i < count; ++i) {
      clients.push_back(std::make_unique<ServiceClient>(service.socketPath()));
      clients.back()->startSessions(kSession + i, 1);
    }
    for (auto& client : clients) client->waitUntilServed();
    const std::uint64_t bursts = scale.messages / kBurst;
    const auto sendInTurn = [&] {
      for (std::uint64_t burst = 0; burst < bursts; ++burst) {
        const std::uint64_t turn = burst % clients.size();
        clients[turn]->send(kBurst, kSession + static_cast<std::int64_t>(turn));
      }
    };
    deliver(service, bursts * kBurst, sendInTurn);
    curve.add(static_cast<double>(count),
              deliver(service, bursts * kBurst, sendInTurn).processorNanoseconds);
  }
  return curve;
}

Curve growWithSessions(const Scale& scale) {
  Curve curve{"sessions", "started sessions", kCostLabel, {}};
  for (std::int64_t count = 1; count <= scale.sessions; count *= 10) {
    ServiceProcess service({.kind = ServiceKind::kCounting});
    ServiceClient client(service.socketPath());
    client.startSessions(kSession, count);
    deliver(service, static_cast<std::uint64_t>(count),
            [&] { client.send(static_cast<std::uint64_t>(count), kSession, count); });
    curve.add(static_cast<double>(count), deliver(service, scale.messages, [&] {
                                            client.send(scale.messages, kSession, count);
                                          }).processorNanoseconds);
  }
  return curve;
}

Curve growWithMessagesKept(const Scale& scale) {
  Curve curve{"messages_kept", "messages kept in one session", kCostLabel, {}};
  ServiceProcess service({.kind = ServiceKind::kCounting});
  ServiceClient client(service.socketPath());
  client.startSessions(kSession, 2);
  // What a service that has just started takes is not what is looked for.
  deliver(service, scale.messages / 10,
          [&] { client.send(scale.messages / 10, kSession + 1); });
  const std::uint64_t probe = scale.messages / 100;
  std::uint64_t kept = 0;
  const auto sendMore = [&](std::uint64_t count) {
    kept += count;
    return deliver(service, count, [&] { client.send(count, kSession); });
  };
  for (std::uint64_t wanted = 1; wanted <= scale.messages; wanted *= 10) {
    if (wanted < kept) continue;
    sendMore(wanted - kept);
    // The median of some: one takes a few milliseconds.
    std::array<double, 5> costs;
    for (double& cost : costs) cost = sendMore(probe).processorNanoseconds;
    std::ranges::sort(costs);
    curve.add(static_cast<double>(wanted), costs[costs.size() / 2]);
  }
  return curve;
}

}  // namespace

bool writeGrowthCurves(const Scale& scale, const std::string& path) {
  const Curve curves[] = {growWithClients(scale), growWithSessions(scale),
                          growWithMessagesKept(scale)};
  std::ofstream out(path);
  out << "{\"curves\": [";
  const char* separator = "\n  ";
  for (const Curve& curve : curves) {
    out << separator << "{\"name\": \"" << curve.name << "\", \"x_label\": \""
        << curve.xLabel << "\", \"y_label\": \"" << curve.yLabel << "\", \"points\": [";
    const char* comma = "";
    for (const auto& [x, y] : curve.points) {
      out << comma << '[' << x << ", " << y << ']';
      comma = ", ";
    }
    out << "]}";
    separator = ",\n  ";
  }
  out << "\n]}\n";
  out.close();
  return !out.fail();
}

}  // namespace ostrel::bench
