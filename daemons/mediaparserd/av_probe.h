// The container, streams and codecs of a file, from libavformat.
//
// The format is decided by the content alone: the probe is given no file
// name, so an MP3 named .mp4 is an MP3 and a text file named .png is
// nothing. All reading goes through a BoundedReader, whose deadline also
// interrupts libavformat between reads; probing and stream analysis read at
// most the sizes in ProbeLimits.
//
// libavformat keeps no state between calls here; set its process-wide
// limits (log level, largest allocation) once with InitMediaLibraries
// (media_parser.h). Single-threaded per reader.
#ifndef MEDIAPARSERD_AV_PROBE_H_
#define MEDIAPARSERD_AV_PROBE_H_

#include <stdint.h>

#include <string>

#include "media_facts.h"
#include "peer_file.h"

namespace mediaparserd {

struct ProbeLimits {
  int64_t probe_bytes = 1 << 20;     // read to recognise the format
  int64_t analyze_bytes = 2 << 20;   // of packets read to learn the streams
  int64_t analyze_us = 3 * 1000000;  // of media analysed, microseconds
  int max_streams = 64;              // streams a container may open
  // Read by libavformat in all, headers and indexes included; past them it
  // sees the end of the file. (Its analysis counts only the packets its
  // parsers find: in a stream of garbage or zeros it would read on to the
  // end of the file.)
  int64_t read_bytes = 32 << 20;
};

enum class ProbeResult {
  kOk,        // *facts filled
  kNotMedia,  // no container format recognised in the content
  kDamaged,   // a format was recognised, its header could not be read
  kStopped,   // the reader stopped (deadline, budget, read error)
};

// Probes the file behind `reader` (read from offset 0). On kOk fills
// *facts; on kDamaged *detail holds the format's name and libavformat's
// error text ("mov,mp4,m4a,3gp,3g2,mj2: Invalid data found when processing
// input"); *facts is unspecified after any result other than kOk.
ProbeResult ProbeContainer(BoundedReader* reader, const ProbeLimits& limits,
                           ContainerFacts* facts, std::string* detail);

}  // namespace mediaparserd

#endif  // MEDIAPARSERD_AV_PROBE_H_
