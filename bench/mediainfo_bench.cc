// Media record conversions and the UTF-8 clean-up, each against the least
// the same work takes with its libraries alone:
//   record/to-json:      MediaInfoObject2Json + Json::FastWriter per record;
//   record/write-only:   Json::FastWriter on the same, prebuilt document;
//   record/from-json:    Json::Reader + MediaInfoJson2Object per record;
//   record/parse-only:   Json::Reader on the same text;
//   valid/clean-record:  MediaInfoValid on a record whose tags are clean
//                        UTF-8 (the common case: nothing to convert);
//   valid/icu-only:      u_strFromUTF8 on the same six tag texts.
// The summary prints library / baseline ratios of CPU time.
#include <stdio.h>
#include <string.h>

#include <string>

#include <benchmark/benchmark.h>
#include <json/json.h>
#include <unicode/ustring.h>

#include "bench_support.h"
#include "quvaidx/mediainfo.h"
#include "quvaidx/text.h"

namespace qb = quvaidx_bench;

namespace {

__tag_QUVA_MEDIA_INFO SampleRecord() {
  __tag_QUVA_MEDIA_INFO r;
  memset(&r, 0, sizeof(r));
  r.ID = 123456;
  strcpy(r.szPath,
         "/share/Multimedia/Music/Some Artist/Some Album/01 track.flac");
  strcpy(r.szName, "01 track.flac");
  strcpy(r.szTitle, "Песня о главном");
  strcpy(r.szAlbum, "专辑名称 Deluxe Edition");
  strcpy(r.szArtist, "Some Artist feat. Другой");
  strcpy(r.szAlbumArtist, "Some Artist");
  strcpy(r.szGenre, "Électronique");
  strcpy(r.szComposer, "Composer Name");
  strcpy(r.szComment, "Ripped with care \xF0\x9F\x8E\xB5");
  strcpy(r.szDate, "2020-05-01");
  strcpy(r.szMDate, "2021-06-02 10:11:12");
  r.duration = 245.5f;
  r.audio_bitrate = 1411000;
  r.frequency = 44100;
  r.channel = 2;
  r.fileSize = 5ull << 30;
  r.track = 1;
  r.year = 2020;
  strcpy(r.szAudioCodec, "flac");
  strcpy(r.szContainerType, "flac");
  strcpy(r.szFsUUID, "3f1c2a9e-0d4b-4e57-9d1a-5b7c2e8f6a10");
  return r;
}

void BM_ToJson(benchmark::State& state) {
  __tag_QUVA_MEDIA_INFO r = SampleRecord();
  Json::FastWriter writer;
  for (auto _ : state) {
    Json::Value json;
    MediaInfoObject2Json(r, json);
    std::string text = writer.write(json);
    benchmark::DoNotOptimize(text.data());
  }
}

void BM_WriteOnly(benchmark::State& state) {
  __tag_QUVA_MEDIA_INFO r = SampleRecord();
  Json::Value json;
  MediaInfoObject2Json(r, json);
  Json::FastWriter writer;
  for (auto _ : state) {
    std::string text = writer.write(json);
    benchmark::DoNotOptimize(text.data());
  }
}

std::string SampleText() {
  __tag_QUVA_MEDIA_INFO r = SampleRecord();
  Json::Value json;
  MediaInfoObject2Json(r, json);
  return Json::FastWriter().write(json);
}

void BM_FromJson(benchmark::State& state) {
  const std::string text = SampleText();
  __tag_QUVA_MEDIA_INFO r;
  for (auto _ : state) {
    Json::Value json;
    Json::Reader().parse(text, json, true);
    MediaInfoJson2Object(json, r);
    benchmark::DoNotOptimize(&r);
  }
}

void BM_ParseOnly(benchmark::State& state) {
  const std::string text = SampleText();
  for (auto _ : state) {
    Json::Value json;
    Json::Reader().parse(text, json, true);
    benchmark::DoNotOptimize(&json);
  }
}

void BM_ValidClean(benchmark::State& state) {
  const __tag_QUVA_MEDIA_INFO clean = SampleRecord();
  __tag_QUVA_MEDIA_INFO r = clean;
  for (auto _ : state) {
    MediaInfoValid(&r);
    benchmark::DoNotOptimize(&r);
  }
  if (memcmp(&r, &clean, sizeof(r)) != 0) state.SkipWithError("record changed");
}

void BM_IcuOnly(benchmark::State& state) {
  const __tag_QUVA_MEDIA_INFO r = SampleRecord();
  const char* texts[] = {r.szTitle,   r.szArtist, r.szComposer,
                         r.szComment, r.szAlbum,  r.szGenre};
  UChar units[kMediaTagSize + 1];
  for (auto _ : state) {
    int ok = 0;
    for (const char* text : texts) {
      UErrorCode status = U_ZERO_ERROR;
      int32_t written = 0;
      u_strFromUTF8(units, kMediaTagSize + 1, &written, text, -1, &status);
      ok += U_SUCCESS(status) ? 1 : 0;
    }
    benchmark::DoNotOptimize(ok);
  }
}

void Summarise(const qb::KeepingReporter& r) {
  struct Pair {
    const char* label;
    const char* library;
    const char* baseline;
  };
  const Pair pairs[] = {
      {"to JSON + FastWriter / FastWriter alone", "record/to-json",
       "record/write-only"},
      {"Reader + from JSON / Reader alone", "record/from-json",
       "record/parse-only"},
      {"MediaInfoValid (clean) / six u_strFromUTF8", "valid/clean-record",
       "valid/icu-only"},
  };
  printf("\n== media record summary (median CPU ns per record)\n");
  for (const Pair& p : pairs) {
    double lib = r.CpuNsPerOp(p.library);
    double base = r.CpuNsPerOp(p.baseline);
    printf("  %-44s %8.0f / %8.0f ns\n", p.label, lib, base);
    qb::PrintRatio(p.label, lib / base, "x");
  }
}

}  // namespace

int main(int argc, char** argv) {
  benchmark::RegisterBenchmark("record/to-json", BM_ToJson);
  benchmark::RegisterBenchmark("record/write-only", BM_WriteOnly);
  benchmark::RegisterBenchmark("record/from-json", BM_FromJson);
  benchmark::RegisterBenchmark("record/parse-only", BM_ParseOnly);
  benchmark::RegisterBenchmark("valid/clean-record", BM_ValidClean);
  benchmark::RegisterBenchmark("valid/icu-only", BM_IcuOnly);
  qb::KeepingReporter reporter;
  int rc = qb::RunAll(argc, argv, &reporter);
  if (rc == 0) Summarise(reporter);
  return rc;
}
