#include "extract/ocr.hpp"

#include <gtest/gtest.h>

#include <cstdlib>

#include "extract/extractor_test_util.hpp"
#include "test/sample_files.hpp"

namespace orvane {
namespace extract {
namespace {

using OcrTest = ExtractorTest;

TEST_F(OcrTest, WordsDrawnInAnImageAreRecognisedAndTinyImagesSkipped) {
  // Two words rendered to a greyscale PNG by ghostscript.
  const std::string ps = dir_.Write("w.ps",
                                    "%!PS\n/Helvetica findfont 40 scalefont setfont\n"
                                    "30 40 moveto (Quokka lighthouse) show\nshowpage\n");
  ASSERT_EQ(std::system(("gs -q -dSAFER -dBATCH -dNOPAUSE -sDEVICE=pnggray -r150 "
                         "-dDEVICEWIDTHPOINTS=400 -dDEVICEHEIGHTPOINTS=120 -sOutputFile=" +
                         dir_.Path("w.png") + " " + ps)
                            .c_str()),
            0);
  const Json::Value f = Run(ExtractImageWithText, dir_.Path("w.png"));
  EXPECT_EQ(f["QUIXMDMediaTypes"], "Image");
  EXPECT_NE(f["QUIXMDTextContent"].asString().find("Quokka lighthouse"), std::string::npos)
      << f["QUIXMDTextContent"];
  // An icon keeps its metadata and is not read.
  const Json::Value icon =
      Run(ExtractImageWithText, dir_.Write("icon.png", test::SamplePng(16, 16)));
  EXPECT_EQ(icon["QUIXMDMediaTypes"], "Image");
  EXPECT_FALSE(icon.isMember("QUIXMDTextContent"));
}

TEST_F(OcrTest, LanguageListComesFromTheEnvironmentWhenValid) {
  const struct {
    const char* value;
    const char* want;
  } cases[] = {{nullptr, "eng"},
               {"", "eng"},
               {"eng+deu", "eng+deu"},
               {"chi_sim", "chi_sim"},
               {"../../etc/passwd", "eng"},
               {"eng deu", "eng"}};
  for (const auto& c : cases) {
    if (c.value == nullptr) {
      unsetenv("FILEINDEX_OCR_LANGUAGES");
    } else {
      setenv("FILEINDEX_OCR_LANGUAGES", c.value, 1);
    }
    EXPECT_EQ(OcrLanguages(), c.want) << (c.value ? c.value : "(unset)");
  }
  unsetenv("FILEINDEX_OCR_LANGUAGES");
}

}  // namespace
}  // namespace extract
}  // namespace orvane
