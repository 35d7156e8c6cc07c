#!/usr/bin/env bash
# Makes the media fixtures of the parser's tests, benchmarks and fuzz seeds
# from nothing: ffmpeg's test sources, exiftool for EXIF and the rotation of a
# video track, and fixture_tags.py for the bytes no tool writes
# (legacy-encoded ID3 tags, HE-AAC signalling).
#
#   make_fixtures.sh DIR
#
# Writes the files into DIR and a stamp; a later run with the same script,
# helper and ffmpeg returns at once. Takes a few seconds.
set -euo pipefail

dir=$1
here=$(cd "$(dirname "$0")" && pwd)
for tool in ffmpeg exiftool python3; do
  command -v "$tool" >/dev/null || {
    echo "make_fixtures.sh: $tool is missing (scripts/deps.sh installs it)" >&2
    exit 1
  }
done
stamp=$(cat "$0" "$here/fixture_tags.py" | cksum)-$(ffmpeg -version | head -n 1 | cksum)
if [ -f "$dir/stamp" ] && [ "$(cat "$dir/stamp")" = "$stamp" ]; then exit 0; fi

mkdir -p "$dir"
dir=$(cd "$dir" && pwd)
work=$(mktemp -d "$dir/.work.XXXXXX")
trap 'rm -rf "$work"' EXIT
cd "$work"

ff() { ffmpeg -nostdin -hide_banner -loglevel error -y "$@"; }
tone() { echo "sine=frequency=440:duration=1:sample_rate=$1"; }
# job CMD...: runs CMD in the background, at most two at a time; a failing
# job fails the script when it is collected.
job() {
  if [ "$(jobs -rp | wc -l)" -ge 2 ]; then wait -n; fi
  "$@" &
}
collect() { while [ -n "$(jobs -p)" ]; do wait -n; done; }

# The tags of the well-formed music files.
tags=(-metadata title="Song Title" -metadata artist="The Artist"
      -metadata album="The Album" -metadata album_artist="Various Artists"
      -metadata genre="Rock" -metadata composer="A Composer"
      -metadata comment="A comment" -metadata track=3/12 -metadata disc=1/2
      -metadata date=2021)

job ff -f lavfi -i testsrc=size=64x64:rate=1 -frames:v 1 cover.png
job ff -f lavfi -i "$(tone 22050)" -ac 1 -c:a libmp3lame -b:a 32k \
  -id3v2_version 0 -write_id3v1 0 plain.mp3
job ff -f lavfi -i "$(tone 22050)" -ac 2 -c:a aac -b:a 32k lc22k.m4a
collect
# The legacy tags and HE-AAC (a system python3 starts faster than a shim).
python=$(command -v /usr/bin/python3 || command -v python3)
job "$python" "$here/fixture_tags.py" plain.mp3 lc22k.m4a

# MP3: ID3v2.4 (UTF-8, with a cover), ID3v2.3 (UTF-16 for the texts that are
# not ASCII), and the legacy tags.
job ff -i plain.mp3 -i cover.png -map 0 -map 1 -c copy \
  -disposition:v attached_pic "${tags[@]}" -metadata title="Überschrift ✓" \
  -id3v2_version 4 song_id3v24.mp3
job ff -i plain.mp3 -c copy "${tags[@]}" -metadata title="Привет, мир" \
  -metadata artist="Zoë" -id3v2_version 3 song_id3v23_utf16.mp3

# Other music containers.
job ff -f lavfi -i "$(tone 44100)" -i cover.png -map 0 -map 1 -ac 2 \
  -c:a flac -c:v copy -disposition:v attached_pic "${tags[@]}" song.flac
job ff -f lavfi -i "$(tone 44100)" -ac 2 -c:a libvorbis -q:a 0 "${tags[@]}" song.ogg
job ff -f lavfi -i "$(tone 44100)" -ac 2 -c:a aac -b:a 96k "${tags[@]}" song_lc.m4a
job ff -f lavfi -i "$(tone 44100)" -ac 2 -c:a pcm_s16le \
  -metadata title="Wave Title" -metadata artist="Wave Artist" song.wav
# The other tag readers: AIFF (ID3v2), TTA, and Ogg's Opus, Speex and FLAC;
# ASF and WavPack (APE) with the tags whose keys ffmpeg and TagLib share, and
# an APE album artist under the key only TagLib knows.
for format in "aiff pcm_s16be -write_id3v2 1" "tta tta" "opus libopus" \
  "spx libspeex -ar 16000" "oga flac"; do
  set -- $format
  job ff -f lavfi -i "$(tone 44100)" -ac 2 -c:a "$2" "${@:3}" "${tags[@]}" "song.$1"
done
job ff -f lavfi -i "$(tone 44100)" -ac 2 -c:a wmav2 "${tags[@]:0:8}" \
  -metadata genre=Rock -metadata track=3/12 song.wma
job ff -f lavfi -i "$(tone 44100)" -ac 2 -c:a wavpack "${tags[@]:0:6}" \
  -metadata genre=Rock -metadata track=3/12 -metadata "Album Artist=Various Artists" song.wv

# Video: H.264 High with AAC in MP4, to be shown turned by 90 degrees; H.264
# Main with Vorbis in Matroska, anamorphic (4:3 samples), whose second stream
# has a tag that is not the file's.
job ff -f lavfi -i testsrc=size=320x240:rate=25:duration=1 -f lavfi -i "$(tone 48000)" \
  -c:v libx264 -profile:v high -preset superfast -pix_fmt yuv420p \
  -c:a aac -b:a 64k -metadata title="Rotated Clip" video_rot90.mp4
job ff -f lavfi -i testsrc=size=320x240:rate=30:duration=1 -f lavfi -i "$(tone 44100)" \
  -c:v libx264 -profile:v main -preset superfast -pix_fmt yuv420p -aspect 16:9 \
  -c:a libvorbis -metadata title="Matroska Clip" -metadata artist="Clip Maker" \
  -metadata:s:a:0 genre="Stream Genre" video.mkv
# Profiles from the configuration record alone: H.264 Constrained Baseline
# with AAC, and HEVC Main without sound.
job ff -f lavfi -i testsrc=size=160x120:rate=25:duration=1 -f lavfi -i "$(tone 48000)" \
  -c:v libx264 -profile:v baseline -preset superfast -pix_fmt yuv420p -c:a aac \
  -b:a 32k video_baseline.mp4
job ff -f lavfi -i testsrc=size=160x120:rate=25:duration=1 -c:v libx265 \
  -preset superfast -x265-params log-level=error -pix_fmt yuv420p -tag:v hvc1 video_hevc.mp4

# Photos: a JPEG to get EXIF; PNG, GIF, TIFF (read whole), BMP, WebP.
job ff -f lavfi -i testsrc=size=640x480:rate=1 -frames:v 1 photo_exif.jpg
for format in png gif tif bmp webp; do
  job ff -f lavfi -i testsrc=size=200x100:rate=1 -frames:v 1 "photo.$format"
done
collect

# One exiftool run writes the EXIF of the photo and the video's rotation.
exiftool -Make="Canon" -Model="Canon EOS 5D Mark IV" -ExposureTime=1/125 \
  -FNumber=2.8 -ISO=400 -Orientation#=6 "-DateTimeOriginal=2021:05:01 12:34:56" \
  photo_exif.jpg photo.tif -execute -Rotation=90 video_rot90.mp4 \
  -common_args -q -overwrite_original

rm plain.mp3 lc22k.m4a cover.png
mv ./* "$dir/"
echo "$stamp" >"$dir/stamp"
