// Small real files of the kinds content extraction reads (PDF, zip-based office documents, WAV
// audio, PNG images), made in code rather than shipped, for the extraction tests and the
// indexing benchmark. Stateless; safe from any thread.
#ifndef ORVANE_TEST_SAMPLE_FILES_HPP_
#define ORVANE_TEST_SAMPLE_FILES_HPP_

#include <cstdint>
#include <map>
#include <string>

namespace orvane {
namespace test {

// A one-page PDF showing `text` in Helvetica, with `title`, an author and a creation date.
std::string SamplePdf(const std::string& title, const std::string& text);

// Writes a zip file holding `members` (name to contents) at `path`; false when it cannot.
bool WriteSampleZip(const std::string& path, const std::map<std::string, std::string>& members);

// A grey RGB PNG image of `width` by `height` pixels.
std::string SamplePng(uint32_t width, uint32_t height);

// A silent 16-bit PCM WAV file.
std::string SampleWav(int seconds, uint32_t rate, uint16_t channels);

}  // namespace test
}  // namespace orvane

#endif  // ORVANE_TEST_SAMPLE_FILES_HPP_
