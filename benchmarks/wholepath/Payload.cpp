#include "benchmarks/wholepath/Payload.h"

#include <cstdio>
#include <cstdlib>

namespace ostrel::bench {

reporting::Message examplePayload() {
  reporting::Message message{{"route", "Speaker"},
                             {"codec", "aac-eld"},
                             {"application", "com.orbisk.music"},
                             {"reason", "category change by user"},
                             {"sample_rate", 48000},
                             {"channels", 2},
                             {"underruns", 317},
                             {"buffer_frames", 1024},
                             {"latency", 0.0213},
                             {"formats", reporting::List{"pcm", "aac", "opus", 24}}};
  if (message.encoded().size() != kPayloadBytes) {
    std::fprintf(stderr, "the example payload has %zu bytes, not %zu\n",
                 message.encoded().size(), kPayloadBytes);
    std::exit(EXIT_FAILURE);
  }
  return message;
}

std::string rawFrame() {
  std::string frame;
  for (int shift = 0; shift < 32; shift += 8) {
    frame += static_cast<char>(kPayloadBytes >> shift);
  }
  frame += examplePayload().encoded();
  return frame;
}

std::size_t bytesOnTheWire() {
  const reporting::PreparedMessage prepared(
      examplePayload(), kExampleCategory, kExampleType, {{reporting::ReporterID{4711}}});
  return prepared.frame().size();
}

}  // namespace ostrel::bench
