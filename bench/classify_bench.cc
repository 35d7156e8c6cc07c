// Media table lookup by extension, as the scanner does for every file:
// GetMediaTableTypeFromExt over a realistic mix of 1,000 extensions, against
// a baseline in the same binary that walks the same four lists (Music,
// Video, Photo, Playlist) with strcasecmp. Both answer identically (checked
// before timing); the summary prints ns per call and the ratio.
#include <stdio.h>
#include <stdlib.h>
#include <strings.h>

#include <random>
#include <string>
#include <vector>

#include "bench_support.h"
#include "file/ext_lists.h"
#include "quvaidx/media_type.h"

namespace qb = quvaidx_bench;

namespace {

constexpr int kMixSize = 1000;

// A share's worth of extensions: mostly photos and music and video in
// their usual spellings, some side files, a few odd ones.
const std::vector<std::string>& Mix() {
  static const std::vector<std::string> mix = [] {
    const struct {
      const char* ext;
      int weight;
    } kinds[] = {
        {"jpg", 220},  {"JPG", 120},  {"mp3", 140}, {"mp4", 60},  {"mkv", 40},
        {"png", 50},   {"txt", 30},   {"nfo", 25},  {"flac", 30}, {"MP4", 20},
        {"jpeg", 15},  {"CR2", 15},   {"srt", 20},  {"m4a", 25},  {"avi", 15},
        {"heic", 20},  {"xml", 15},   {"db", 10},   {"m3u", 10},  {"gif", 10},
        {"mov", 15},   {"ts", 10},    {"pdf", 10},  {"ini", 5},   {"dvr-ms", 5},
        {"Thumbs", 5}, {"tar.gz", 5}, {"wav", 10},  {"NEF", 10},  {"ogg", 10},
    };
    std::vector<std::string> all;
    for (const auto& k : kinds) all.insert(all.end(), k.weight, k.ext);
    std::mt19937 rng(20150307);
    std::vector<std::string> picked;
    for (int i = 0; i < kMixSize; ++i)
      picked.push_back(all[rng() % all.size()]);
    return picked;
  }();
  return mix;
}

int InListStrcasecmp(const char* ext, const char* const* list) {
  for (; *list != nullptr; ++list) {
    if (strcasecmp(ext, *list) == 0) return 1;
  }
  return 0;
}

int BaselineTableType(const char* ext) {
  namespace e = quvaidx::ext;
  if (ext == nullptr) return MEDIA_TABLE_NONE;
  if (InListStrcasecmp(ext, e::kMusic)) return MEDIA_TABLE_MUSIC;
  if (InListStrcasecmp(ext, e::kVideo)) return MEDIA_TABLE_VIDEO;
  if (InListStrcasecmp(ext, e::kPhoto)) return MEDIA_TABLE_PHOTO;
  if (InListStrcasecmp(ext, e::kPlaylist)) return MEDIA_TABLE_PLAYLIST;
  return MEDIA_TABLE_NONE;
}

template <int (*kLookup)(const char*)>
void BM_Lookup(benchmark::State& state) {
  std::vector<const char*> exts;
  for (const std::string& e : Mix()) exts.push_back(e.c_str());
  for (auto _ : state) {
    int sum = 0;
    for (const char* e : exts) sum += kLookup(e);
    benchmark::DoNotOptimize(sum);
  }
  state.SetItemsProcessed(state.iterations() * exts.size());
}

}  // namespace

int main(int argc, char** argv) {
  for (const std::string& e : Mix()) {
    if (GetMediaTableTypeFromExt(e.c_str()) != BaselineTableType(e.c_str())) {
      fprintf(stderr, "classify_bench: answers differ for %s\n", e.c_str());
      return 1;
    }
  }
  benchmark::RegisterBenchmark("classify/library",
                               BM_Lookup<GetMediaTableTypeFromExt>);
  benchmark::RegisterBenchmark("classify/strcasecmp",
                               BM_Lookup<BaselineTableType>);
  qb::KeepingReporter reporter;
  int rc = qb::RunAll(argc, argv, &reporter);
  if (rc != 0) return rc;
  const double lib = reporter.CpuNsPerOp("classify/library") / kMixSize;
  const double base = reporter.CpuNsPerOp("classify/strcasecmp") / kMixSize;
  printf("\nGetMediaTableTypeFromExt over %d mixed extensions (CPU time):\n",
         kMixSize);
  qb::PrintRatio("library, per call", lib, "ns");
  qb::PrintRatio("strcasecmp loop, per call", base, "ns");
  qb::PrintRatio("library / strcasecmp loop", lib / base, "x");
  qb::PrintGoal("library no slower than the strcasecmp loop", lib / base, 1.0,
                /*at_most=*/true);
  return 0;
}
