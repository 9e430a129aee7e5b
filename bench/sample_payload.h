#pragma once

#include "common/Value.h"

namespace qn::bench {

// The payload of a typical sendMessage: 8 keys, about 200 bytes on the wire, with strings,
// integers, doubles and a nested dictionary, as an audio driver reports a stream.
inline Value SamplePayload() {
  Dictionary nested{{"rate", 48000}, {"channels", 2}, {"format", "s24le"}};
  return Value(Dictionary{
      {"device", "alsa_output.pci-0000_00_1f.3.analog-stereo"},
      {"client", "org.example.Player"},
      {"underruns", 3},
      {"latency_ms", 21.333},
      {"buffer_frames", 1024},
      {"cpu_load", 0.0742},
      {"route", "speaker"},
      {"stream", Value(std::move(nested))},
  });
}

// A whole sendMessage request: [op, request id, payload, category, type, [reporter ids]].
inline Value SampleSendMessageRequest() {
  return Value(Array{6, 48213, SamplePayload(), 0x10003, 7, Array{4242, 4243}});
}

}  // namespace qn::bench
