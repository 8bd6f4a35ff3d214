#include <cstdio>
#include <ctime>
#include <exiv2/exiv2.hpp>

#include "extract/extractor.hpp"

namespace orvane {
namespace extract {
namespace {

time_t ExifTime(const std::string& text) {
  struct tm tm = {};
  if (strptime(text.c_str(), "%Y:%m:%d %H:%M:%S", &tm) == nullptr) return 0;
  return timegm(&tm);
}

}  // namespace

void ExtractPhoto(const OpenedFile& file, Json::Value& fields) {
  Exiv2::LogMsg::setLevel(Exiv2::LogMsg::mute);
  auto image = Exiv2::ImageFactory::open(file.proc_path(), false);
  if (image.get() == nullptr) Fail("not a readable image");
  image->readMetadata();
  fields["QUIXMDMediaTypes"] = "Image";
  if (image->pixelWidth() > 0 && image->pixelHeight() > 0) {
    fields["QUIXMDPixelWidth"] = static_cast<Json::Int64>(image->pixelWidth());
    fields["QUIXMDPixelHeight"] = static_cast<Json::Int64>(image->pixelHeight());
  }
  const Exiv2::ExifData& exif = image->exifData();
  auto get = [&exif](const char* key) -> const Exiv2::Exifdatum* {
    auto it = exif.findKey(Exiv2::ExifKey(key));
    return it == exif.end() ? nullptr : &*it;
  };
  if (auto* d = get("Exif.Image.Make")) SetText(fields, "QUIXMDAcquisitionMake", d->toString());
  if (auto* d = get("Exif.Image.Model")) SetText(fields, "QUIXMDAcquisitionModel", d->toString());
  if (auto* d = get("Exif.Image.ImageDescription")) {
    SetText(fields, "QUIXMDDescription", d->toString());
  }
  if (auto* d = get("Exif.Photo.ExposureTime")) {
    SetText(fields, "QUIXMDExposureTimeString", d->toString());
  }
  if (auto* d = get("Exif.Photo.FNumber")) {
    char text[32];
    std::snprintf(text, sizeof(text), "f/%.1f", d->toFloat());
    fields["QUIXMDAperture"] = text;
  }
  if (auto* d = get("Exif.Photo.ISOSpeedRatings")) {
    fields["QUIXMDISOSpeed"] = static_cast<Json::Int64>(d->toLong());
  }
  if (auto* d = get("Exif.Image.XResolution")) {
    fields["QUIXMDResolutionWidthDPI"] = static_cast<Json::Int64>(d->toFloat());
  }
  if (auto* d = get("Exif.Image.YResolution")) {
    fields["QUIXMDResolutionHeightDPI"] = static_cast<Json::Int64>(d->toFloat());
  }
  if (auto* d = get("Exif.Photo.DateTimeOriginal")) {
    if (time_t t = ExifTime(d->toString())) {
      fields["QUIXMDContentCreationDate"] = static_cast<Json::Int64>(t);
    }
  }
}

}  // namespace extract
}  // namespace orvane
