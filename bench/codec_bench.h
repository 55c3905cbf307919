// Cost of the listeners message: encode, verify and decode (read) per
// listener at several table sizes. Pure code: the same source runs in the
// cross build under Wine and in a native build, so the two can be compared.
#pragma once

#include <cstddef>
#include <cstdint>
#include <string>
#include <vector>

#include "bus/listener.h"

namespace bench {

// The names every listener benchmark uses: channel "bench" and a 19-byte id,
// which put a listener at 52 bytes in the message.
std::string bench_listener_id(std::size_t index);
listener_list make_listener_table(std::size_t count);

struct codec_row {
  std::size_t listeners = 0;
  std::size_t message_bytes = 0;
  double encode_ns = 0;  // per listener, fastest batch
  double verify_ns = 0;
  double decode_ns = 0;  // read_listeners after a successful verify
};

// Times each operation in `batches` batches of about `batch_ms` and keeps
// the fastest; `sizes` in ascending order.
std::vector<codec_row> run_codec_bench(const std::vector<std::size_t>& sizes, double batch_ms = 2,
                                       int batches = 60);

// A markdown table of the rows, titled with `platform`, with the goals:
// verify <= 15 ns and encode <= 50 ns per listener at every size, and 1,000
// listeners costing at most 12 x 100.
std::string codec_markdown(const std::string& platform, const std::vector<codec_row>& rows);

// "N encode verify decode" lines (ns per listener) for the plot.
std::string codec_data(const std::vector<codec_row>& rows);

}  // namespace bench
