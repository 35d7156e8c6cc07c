// The lines that queue-file targets put before the fuzzer's bytes, so that
// short inputs still reach files that span several copy blocks.
#ifndef QUVAIDX_FUZZ_QUEUE_FILLER_H_
#define QUVAIDX_FUZZ_QUEUE_FILLER_H_

#include <stddef.h>

#include <string>

namespace fuzz_queue {

// A length unit that falls on no power of two, so that multiples of it end
// anywhere within a copy block.
constexpr size_t kFillerUnit = 2731;

// `bytes` bytes of lines of 1 to 97 bytes ('\n' included), the last one
// possibly cut.
inline std::string Filler(size_t bytes) {
  std::string text;
  for (int i = 0; text.size() < bytes; ++i) {
    text.append(static_cast<size_t>(i * 37 % 97),
                static_cast<char>('a' + i % 26));
    text += '\n';
  }
  text.resize(bytes);
  return text;
}

}  // namespace fuzz_queue

#endif  // QUVAIDX_FUZZ_QUEUE_FILLER_H_
