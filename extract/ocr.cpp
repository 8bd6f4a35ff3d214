#include "extract/ocr.hpp"

#include <leptonica/allheaders.h>
#include <syslog.h>
#include <tesseract/baseapi.h>
#include <tesseract/ocrclass.h>

#include <cstdlib>
#include <memory>

#include "common/log.hpp"
#include "common/util.hpp"
#include "extract/content.hpp"

namespace orvane {
namespace extract {
namespace {

// Recognition gives up here, well before the helper is killed for the file.
constexpr int kOcrDeadlineMs = 20000;

// The engine with its language data loaded once per helper and kept for the process's life (its
// word lists are shared through a cache of the library's own, which is not torn down); null when
// it cannot be loaded, which is logged once.
tesseract::TessBaseAPI* Engine() {
  static tesseract::TessBaseAPI* const engine = []() -> tesseract::TessBaseAPI* {
    // One thread: the helper runs beside the indexer on a shared machine.
    setenv("OMP_THREAD_LIMIT", "1", 0);
    auto api = std::make_unique<tesseract::TessBaseAPI>();
    const std::string languages = OcrLanguages();
    if (api->Init(nullptr, languages.c_str(), tesseract::OEM_DEFAULT) != 0) {
      ORVANE_LOG(LOG_WARNING,
                 "text recognition is off: the language data \"%s\" is not installed "
                 "(install tesseract-ocr-eng or the packages of the languages in "
                 "FILEINDEX_OCR_LANGUAGES)",
                 languages.c_str());
      return nullptr;
    }
    api->SetPageSegMode(tesseract::PSM_AUTO);
    // Recognition of a page never writes debug files next to it.
    api->SetVariable("debug_file", "/dev/null");
    return api.release();
  }();
  return engine;
}

struct PixDeleter {
  void operator()(Pix* pix) const { pixDestroy(&pix); }
};

}  // namespace

std::string OcrLanguages() {
  const char* env = std::getenv("FILEINDEX_OCR_LANGUAGES");
  if (env == nullptr || *env == '\0') return "eng";
  for (const char* p = env; *p != '\0'; ++p) {
    const char c = *p;
    if (!((c >= 'a' && c <= 'z') || (c >= 'A' && c <= 'Z') || c == '_' || c == '+')) {
      return "eng";
    }
  }
  return env;
}

void AddOcrText(const OpenedFile& file, Json::Value& fields) {
  l_int32 format = 0, width = 0, height = 0, bps = 0, spp = 0, cmap = 0;
  if (pixReadHeader(file.proc_path().c_str(), &format, &width, &height, &bps, &spp, &cmap) != 0) {
    return;  // a format the image library does not decode
  }
  const long pixels = static_cast<long>(width) * height;
  if (width < kMinOcrSide || height < kMinOcrSide || pixels < kMinOcrPixels ||
      pixels > kMaxOcrPixels) {
    return;
  }
  tesseract::TessBaseAPI* engine = Engine();
  if (engine == nullptr) return;
  std::unique_ptr<Pix, PixDeleter> pix(pixRead(file.proc_path().c_str()));
  if (!pix) return;
  engine->SetImage(pix.get());
  tesseract::ETEXT_DESC monitor;
  monitor.set_deadline_msecs(kOcrDeadlineMs);
  const bool done = engine->Recognize(&monitor) == 0;
  std::unique_ptr<char[]> text(done ? engine->GetUTF8Text() : nullptr);
  engine->Clear();
  if (!text) return;
  const std::string clean = Trim(CleanUtf8(text.get(), kMaxTextBytes));
  if (!clean.empty()) fields["QUIXMDTextContent"] = clean;
}

void ExtractImageWithText(const OpenedFile& file, Json::Value& fields) {
  ExtractPhoto(file, fields);
  // The photo switch judged the file on disk: an image inside an archive or an attachment was
  // not chosen by it, and keeps its metadata only.
  if (file.depth() == 0) AddOcrText(file, fields);
}

}  // namespace extract
}  // namespace orvane
