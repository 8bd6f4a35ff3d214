#include <MediaInfo/MediaInfo.h>
#include <cstdlib>
#include <string>

#include "common/util.hpp"
#include "extract/extractor.hpp"

namespace orvane {
namespace extract {
namespace {


// UTF-8 and wide strings, both ways; MediaInfo speaks wide strings.
std::wstring Widen(const std::string& s) {
  std::wstring out;
  for (size_t i = 0; i < s.size();) {
    const size_t len = Utf8SequenceLength(s, i);
    if (len == 0) Fail("path is not UTF-8");
    const auto c = static_cast<unsigned char>(s[i]);
    uint32_t cp = len == 1 ? c : c & (0xFF >> (len + 1));
    for (size_t k = 1; k < len; ++k) cp = (cp << 6) | (static_cast<unsigned char>(s[i + k]) & 0x3F);
    out += static_cast<wchar_t>(cp);
    i += len;
  }
  return out;
}

std::string Narrow(const std::wstring& w) {
  std::string out;
  for (wchar_t wc : w) {
    const auto cp = static_cast<uint32_t>(wc);
    if (cp < 0x80) {
      out += static_cast<char>(cp);
    } else if (cp < 0x800) {
      out += static_cast<char>(0xC0 | (cp >> 6));
      out += static_cast<char>(0x80 | (cp & 0x3F));
    } else if (cp < 0x10000) {
      out += static_cast<char>(0xE0 | (cp >> 12));
      out += static_cast<char>(0x80 | ((cp >> 6) & 0x3F));
      out += static_cast<char>(0x80 | (cp & 0x3F));
    } else if (cp <= 0x10FFFF) {
      out += static_cast<char>(0xF0 | (cp >> 18));
      out += static_cast<char>(0x80 | ((cp >> 12) & 0x3F));
      out += static_cast<char>(0x80 | ((cp >> 6) & 0x3F));
      out += static_cast<char>(0x80 | (cp & 0x3F));
    }
  }
  return out;
}


}  // namespace

void ExtractVideo(const OpenedFile& file, Json::Value& fields) {
  MediaInfoLib::MediaInfo info;
  info.Option(L"Internet", L"No");
  if (info.Open(Widen(file.proc_path())) == 0) Fail("not a readable media file");
  auto get = [&info](MediaInfoLib::stream_t stream, const wchar_t* name) {
    return Narrow(info.Get(stream, 0, name));
  };
  auto number = [&](MediaInfoLib::stream_t stream, const wchar_t* name) -> double {
    const std::string text = get(stream, name);
    return text.empty() ? 0 : std::strtod(text.c_str(), nullptr);
  };
  fields["QUIXMDMediaTypes"] = "Video";
  SetText(fields, "QUIXMDTitle", get(MediaInfoLib::Stream_General, L"Title"));
  if (double ms = number(MediaInfoLib::Stream_General, L"Duration")) {
    fields["QUIXMDDurationSecond"] = ms / 1000.0;
  }
  const double width = number(MediaInfoLib::Stream_Video, L"Width");
  const double height = number(MediaInfoLib::Stream_Video, L"Height");
  if (width > 0 && height > 0) {
    fields["QUIXMDPixelWidth"] = static_cast<Json::Int64>(width);
    fields["QUIXMDPixelHeight"] = static_cast<Json::Int64>(height);
  }
  if (double rate = number(MediaInfoLib::Stream_General, L"OverallBitRate")) {
    fields["QUIXMDTotalBitRate"] = static_cast<Json::Int64>(rate);
  }
  if (double rate = number(MediaInfoLib::Stream_Video, L"BitRate")) {
    fields["QUIXMDVideoBitRate"] = static_cast<Json::Int64>(rate);
  }
  if (double rate = number(MediaInfoLib::Stream_Audio, L"BitRate")) {
    fields["QUIXMDAudioBitRate"] = static_cast<Json::Int64>(rate);
  }
  if (double rate = number(MediaInfoLib::Stream_Audio, L"SamplingRate")) {
    fields["QUIXMDAudioSampleRate"] = static_cast<Json::Int64>(rate);
  }
  if (double channels = number(MediaInfoLib::Stream_Audio, L"Channel(s)")) {
    fields["QUIXMDAudioChannelCount"] = static_cast<Json::Int64>(channels);
  }
  const std::string codecs = Trim(get(MediaInfoLib::Stream_Video, L"Format") + " " +
                                  get(MediaInfoLib::Stream_Audio, L"Format"));
  SetText(fields, "QUIXMDCodecs", codecs);
  info.Close();
}

}  // namespace extract
}  // namespace orvane
