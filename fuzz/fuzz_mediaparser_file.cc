// The whole media parser on mutated files: the input is the content of a
// file, which the parser opens by path as it opens a peer's file and reads
// with libavformat, TagLib and exiv2, answering one of the three requests
// about it (scripts/fuzz.sh seeds it with the media fixtures of the tests).
//
// The file is a memfd reached through /proc/self/fd/N, rewritten for every
// input. Checked: the parser answers every input (a refusal carries a
// reason), no exception leaves it, every reply is an object with a boolean
// "success", and a successful media reply holds the 47 fields of the record.
// The libraries themselves are not instrumented; their crashes and the
// sanitizers' findings in what they call from libc still end the run.
#include <stdint.h>
#include <stdio.h>
#include <stdlib.h>
#include <sys/mman.h>
#include <unistd.h>

#include <string>

#include <json/json.h>

#include "media_parser.h"
#include "request_handler.h"

namespace {

int g_fd = -1;
std::string g_path;
mediaparserd::MediaParser* g_parser = nullptr;

[[noreturn]] void Fail(const char* what) {
  fprintf(stderr, "fuzz_mediaparser_file: %s\n", what);
  abort();
}

}  // namespace

extern "C" int LLVMFuzzerInitialize(int*, char***) {
  g_fd = memfd_create("fuzz-media", MFD_CLOEXEC);
  if (g_fd < 0) Fail("no memfd");
  g_path = "/proc/self/fd/" + std::to_string(g_fd);
  mediaparserd::InitMediaLibraries(mediaparserd::kDefaultMaxAlloc);
  mediaparserd::ParserOptions options;
  options.read.time_ms = 2000;
  options.read.bytes = 64 << 20;
  g_parser = new mediaparserd::MediaParser(options);
  return 0;
}

extern "C" int LLVMFuzzerTestOneInput(const uint8_t* data, size_t size) {
  if (ftruncate(g_fd, 0) != 0 ||
      pwrite(g_fd, data, size, 0) != static_cast<ssize_t>(size)) {
    Fail("cannot write the memfd");
  }
  const char* commands[] = {"GET_MEDIA_INFO", "GET_MEDIA_RESOLUTION",
                            "GET_VIDEO_METADATA"};
  {
    const char* command = commands[size % 3];
    Json::Value request(Json::objectValue);
    request["command"] = command;
    request["path"] = g_path;
    Json::Value reply;
    try {
      mediaparserd::HandleRequest(g_parser, request, &reply);
    } catch (...) {
      Fail("an exception left the parser");
    }
    if (!reply.isObject() || !reply["success"].isBool()) Fail("bad reply");
    if (!reply["success"].asBool()) {
      if (!reply["reason"].isString() || reply["reason"].asString().empty()) {
        Fail("refusal without a reason");
      }
    } else if (reply.isMember("media") && reply["media"].size() != 47) {
      Fail("media without its 47 fields");
    }
  }
  return 0;
}
