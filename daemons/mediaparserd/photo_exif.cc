#include "photo_exif.h"

#include <stdio.h>
#include <string.h>

#include <memory>

// exiv2 0.27's interface hands out std::auto_ptr, which C++17 deprecates.
#pragma GCC diagnostic push
#pragma GCC diagnostic ignored "-Wdeprecated-declarations"
#include <exiv2/exiv2.hpp>
#include <exiv2/webpimage.hpp>

namespace mediaparserd {
namespace {

// exiv2's view of the file: read-only, through the reader, no larger than
// kMaxPhotoBytes.
class ReaderIo : public Exiv2::BasicIo {
 public:
  explicit ReaderIo(BoundedReader* reader)
      : reader_(reader),
        size_(reader->size() < kMaxPhotoBytes ? reader->size()
                                              : kMaxPhotoBytes) {}

  int open() override {
    position_ = 0;
    eof_ = false;
    return 0;
  }
  int close() override { return munmap(); }

  long write(const Exiv2::byte*, long) override { return 0; }
  long write(Exiv2::BasicIo&) override { return 0; }
  int putb(Exiv2::byte) override { return EOF; }
  void transfer(Exiv2::BasicIo&) override {
    throw Exiv2::Error(Exiv2::kerFunctionNotSupported, "transfer");
  }

  Exiv2::DataBuf read(long count) override {
    long left = static_cast<long>(size_ - position_);
    Exiv2::DataBuf buffer(count < 0 ? 0 : count < left ? count : left);
    buffer.size_ = read(buffer.pData_, buffer.size_);
    return buffer;
  }

  long read(Exiv2::byte* buffer, long count) override {
    if (count <= 0) return 0;
    if (count > size_ - position_) {
      count = static_cast<long>(size_ - position_);
      eof_ = true;
    }
    int64_t n = count > 0 ? reader_->ReadAt(position_, buffer, count) : 0;
    if (n < 0) {
      error_ = 1;
      eof_ = true;
      return 0;
    }
    if (n < count) eof_ = true;
    position_ += n;
    return static_cast<long>(n);
  }

  int getb() override {
    Exiv2::byte byte;
    return read(&byte, 1) == 1 ? byte : EOF;
  }

  int seek(long offset, Position from) override {
    int64_t base = from == beg ? 0 : from == cur ? position_ : size_;
    if ((offset < 0 && base + offset < 0) ||
        (offset > 0 && offset > size_ - base)) {
      return 1;
    }
    position_ = base + offset;
    eof_ = false;
    return 0;
  }

  // The formats parsed as a whole get a copy, read once, zero-filled where
  // the file has shrunk.
  Exiv2::byte* mmap(bool writeable) override {
    if (writeable) throw Exiv2::Error(Exiv2::kerFunctionNotSupported, "mmap");
    if (copy_ == nullptr) {
      auto copy = std::make_unique<Exiv2::byte[]>(
          static_cast<size_t>(size_ > 0 ? size_ : 1));
      int64_t done = 0;
      while (done < size_) {
        int64_t n = reader_->ReadAt(done, copy.get() + done, size_ - done);
        if (n < 0) throw Exiv2::Error(Exiv2::kerFailedToReadImageData);
        if (n == 0) break;
        done += n;
      }
      memset(copy.get() + done, 0, static_cast<size_t>(size_ - done));
      copy_ = std::move(copy);
    }
    return copy_.get();
  }
  int munmap() override {
    copy_.reset();
    return 0;
  }

  long tell() const override { return static_cast<long>(position_); }
  size_t size() const override { return static_cast<size_t>(size_); }
  bool isopen() const override { return true; }
  int error() const override { return error_; }
  bool eof() const override { return eof_; }
  std::string path() const override { return "(peer file)"; }

 private:
  BoundedReader* reader_;
  int64_t size_;  // what exiv2 sees of the file
  int64_t position_ = 0;
  bool eof_ = false;
  int error_ = 0;
  std::unique_ptr<Exiv2::byte[]> copy_;  // mmap's copy, or null
};

void SetUpExiv2() {
  static const bool done = [] {
    Exiv2::LogMsg::setLevel(Exiv2::LogMsg::mute);
    return true;
  }();
  (void)done;
}

// The still-image formats exiv2 reads. It reads others too, depending on
// how it was built: XMP sidecars, EPS, its own .exv, ISO media files and,
// with video support, QuickTime, RIFF (AVI and WAV), Matroska and ASF, all
// of which are libavformat's to read.
bool IsPhotoType(int type) {
  namespace T = Exiv2::ImageType;
  switch (type) {
    case T::jpeg:
    case T::tiff:  // with DNG, NEF and the other TIFF-based raw formats
    case T::cr2:
    case T::crw:
    case T::mrw:
    case T::orf:
    case T::raf:
    case T::rw2:
    case T::png:
    case T::gif:
    case T::bmp:
    case T::psd:
    case T::jp2:
    case T::pgf:
    case T::webp:
      return true;
    default:
      return false;
  }
}

const Exiv2::Exifdatum* Find(const Exiv2::ExifData& exif, const char* key) {
  Exiv2::ExifData::const_iterator it = exif.findKey(Exiv2::ExifKey(key));
  return it == exif.end() || it->count() == 0 ? nullptr : &*it;
}

void ReadRational(const Exiv2::ExifData& exif, const char* key, int64_t* num,
                  int64_t* den) {
  if (const Exiv2::Exifdatum* datum = Find(exif, key)) {
    Exiv2::Rational value = datum->toRational(0);
    *num = value.first;
    *den = value.second;
  }
}

int64_t ReadNumber(const Exiv2::ExifData& exif, const char* key) {
  const Exiv2::Exifdatum* datum = Find(exif, key);
  return datum == nullptr ? 0 : datum->toLong(0);
}

std::string ReadText(const Exiv2::ExifData& exif, const char* key) {
  const Exiv2::Exifdatum* datum = Find(exif, key);
  return datum == nullptr ? std::string() : datum->toString();
}

void Collect(Exiv2::Image& image, PhotoFacts* facts) {
  const Exiv2::ExifData& exif = image.exifData();
  facts->make = ReadText(exif, "Exif.Image.Make");
  facts->model = ReadText(exif, "Exif.Image.Model");
  ReadRational(exif, "Exif.Photo.ExposureTime", &facts->exposure_num,
               &facts->exposure_den);
  ReadRational(exif, "Exif.Photo.FNumber", &facts->fnumber_num,
               &facts->fnumber_den);
  facts->iso = ReadNumber(exif, "Exif.Photo.ISOSpeedRatings");
  if (facts->iso <= 0) {
    facts->iso = ReadNumber(exif, "Exif.Photo.RecommendedExposureIndex");
  }
  facts->taken = ReadText(exif, "Exif.Photo.DateTimeOriginal");
  facts->orientation = ReadNumber(exif, "Exif.Image.Orientation");
  facts->width = image.pixelWidth();
  facts->height = image.pixelHeight();
  if (facts->width <= 0 || facts->height <= 0) {
    facts->width = ReadNumber(exif, "Exif.Photo.PixelXDimension");
    facts->height = ReadNumber(exif, "Exif.Photo.PixelYDimension");
  }
}

}  // namespace

bool LooksLikePhoto(const uint8_t* head, int64_t size) {
  SetUpExiv2();
  try {
    return IsPhotoType(Exiv2::ImageFactory::getType(
        head, static_cast<long>(size < 4096 ? size : 4096)));
  } catch (...) {
    return false;
  }
}

PhotoResult ReadPhoto(BoundedReader* reader, PhotoFacts* facts,
                      std::string* format, std::string* detail) {
  SetUpExiv2();
  *facts = PhotoFacts();
  try {
    Exiv2::BasicIo::AutoPtr io(new ReaderIo(reader));
    Exiv2::Image::AutoPtr image = Exiv2::ImageFactory::open(io);
    if (image.get() == nullptr || !IsPhotoType(image->imageType())) {
      return reader->stop() != BoundedReader::Stop::kNone
                 ? PhotoResult::kStopped
                 : PhotoResult::kNotPhoto;
    }
    image->readMetadata();
    Collect(*image, facts);
    *format = image->mimeType() == "image/gif" ? "gif" : "image2";
    return PhotoResult::kOk;
  } catch (const std::exception& error) {
    *detail = error.what();
  } catch (...) {
    *detail = "unknown error";
  }
  *facts = PhotoFacts();
  return reader->stop() != BoundedReader::Stop::kNone ? PhotoResult::kStopped
                                                      : PhotoResult::kDamaged;
}

}  // namespace mediaparserd

#pragma GCC diagnostic pop
