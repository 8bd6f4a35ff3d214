#include <taglib/fileref.h>
#include <taglib/tag.h>
#include <taglib/tpropertymap.h>

#include "extract/extractor.hpp"

namespace orvane {
namespace extract {
namespace {

std::string Utf8(const TagLib::String& s) { return s.to8Bit(true); }

}  // namespace

void ExtractAudio(const OpenedFile& opened, Json::Value& fields) {
  // The descriptor's name has no extension: the library tells the format by its contents.
  TagLib::FileRef file(opened.proc_path().c_str(), true, TagLib::AudioProperties::Average);
  if (file.isNull()) Fail("not a readable audio file");
  fields["QUIXMDMediaTypes"] = "Sound";
  if (const TagLib::Tag* tag = file.tag()) {
    SetText(fields, "QUIXMDTitle", Utf8(tag->title()));
    SetText(fields, "QUIXMDAuthors", Utf8(tag->artist()));
    SetText(fields, "QUIXMDAlbum", Utf8(tag->album()));
    SetText(fields, "QUIXMDMusicalGenre", Utf8(tag->genre()));
    SetText(fields, "QUIXMDComment", Utf8(tag->comment()));
    if (tag->year() > 0) fields["QUIXMDRecordingYear"] = static_cast<Json::Int64>(tag->year());
    if (tag->track() > 0) fields["QUIXMDAudioTrackNumber"] = static_cast<Json::Int64>(tag->track());
    const TagLib::PropertyMap properties = tag->properties();
    auto composer = properties.find("COMPOSER");
    if (composer != properties.end() && !composer->second.isEmpty()) {
      SetText(fields, "QUIXMDComposer", Utf8(composer->second.front()));
    }
  }
  if (const TagLib::AudioProperties* audio = file.audioProperties()) {
    fields["QUIXMDDurationSecond"] = audio->lengthInMilliseconds() / 1000.0;
    if (audio->bitrate() > 0) fields["QUIXMDAudioBitRate"] = audio->bitrate();
    if (audio->sampleRate() > 0) fields["QUIXMDAudioSampleRate"] = audio->sampleRate();
    if (audio->channels() > 0) fields["QUIXMDAudioChannelCount"] = audio->channels();
  }
}

}  // namespace extract
}  // namespace orvane
