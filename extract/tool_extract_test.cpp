#include "extract/tool_extract.hpp"

#include <fcntl.h>
#include <gtest/gtest.h>
#include <signal.h>

#include <chrono>
#include <cstdlib>
#include <fstream>

#include "common/fd.hpp"
#include "extract/extractor_test_util.hpp"

namespace orvane {
namespace extract {
namespace {

// A page of PostScript with two words on it, drawn in a font every ghostscript has.
const char kPostScript[] =
    "%!PS\n/Helvetica findfont 40 scalefont setfont\n30 40 moveto (Quokka lighthouse) show\n"
    "showpage\n";

class ToolExtractTest : public ExtractorTest {
 protected:
  // Runs a Debian tool to make a sample file; true when it worked.
  bool Make(const std::string& command) { return std::system(command.c_str()) == 0; }
};

TEST_F(ToolExtractTest, RunToolOutcomes) {
  const std::string input = dir_.Write("in.txt", "tool input\n");
  UniqueFd fd(open(input.c_str(), O_RDONLY | O_CLOEXEC));
  ASSERT_TRUE(fd.valid());
  std::string out;
  std::string error;
  // The input arrives as a name the tool can open, whatever descriptor the caller holds.
  EXPECT_EQ(RunTool({"cat", kToolInput}, fd.get(), ToolLimits(), &out, &error), ToolOutcome::kDone);
  EXPECT_EQ(out, "tool input\n");
  EXPECT_EQ(RunTool({"fileindex-no-such-tool", kToolInput}, fd.get(), ToolLimits(), &out, &error),
            ToolOutcome::kMissing);
  EXPECT_EQ(RunTool({"sh", "-c", "echo partial; exit 3"}, fd.get(), ToolLimits(), &out, &error),
            ToolOutcome::kFailed);
  EXPECT_EQ(error, "exited with status 3");
  // Output past the cap stops the tool instead of filling memory.
  ToolLimits small;
  small.max_output = 1000;
  EXPECT_EQ(RunTool({"yes"}, fd.get(), small, &out, &error), ToolOutcome::kDone);
  EXPECT_EQ(out.size(), 1000u);
}

TEST_F(ToolExtractTest, AHangingToolIsKilledWithEverythingItStarted) {
  const std::string input = dir_.Write("in.txt", "x");
  UniqueFd fd(open(input.c_str(), O_RDONLY | O_CLOEXEC));
  ToolLimits limits;
  limits.timeout_ms = 300;
  std::string out;
  std::string error;
  const auto start = std::chrono::steady_clock::now();
  // The shell starts a sleeper of its own and prints its pid, then waits on it.
  EXPECT_EQ(RunTool({"sh", "-c", "sleep 60 & echo $!; wait"}, fd.get(), limits, &out, &error),
            ToolOutcome::kTimedOut);
  EXPECT_LT(std::chrono::steady_clock::now() - start, std::chrono::seconds(30));
  EXPECT_NE(error.find("took longer than 300 ms"), std::string::npos) << error;
  const pid_t sleeper = std::atoi(out.c_str());
  ASSERT_GT(sleeper, 0) << out;
  // Killed: gone, or a zombie waiting for whoever inherited it.
  bool alive = true;
  for (int i = 0; i < 500 && alive; ++i) {
    std::ifstream stat("/proc/" + std::to_string(sleeper) + "/stat");
    std::string pid, comm, state;
    alive = static_cast<bool>(stat >> pid >> comm >> state) && state != "Z";
    if (alive) usleep(10000);
  }
  EXPECT_FALSE(alive);
}

TEST_F(ToolExtractTest, ConvertersGiveTextAndFields) {
  const Json::Value rtf =
      Run(ExtractRtf, dir_.Write("a.rtf",
                                 "{\\rtf1\\ansi{\\info{\\title Plan}{\\author Grace}}"
                                 "\\pard Hello rtfword caf\\'e9\\par second line\\par}"));
  EXPECT_EQ(rtf["QUIXMDTitle"], "Plan");
  EXPECT_EQ(rtf["QUIXMDAuthors"], "Grace");
  EXPECT_EQ(rtf["QUIXMDTextContent"], "Hello rtfword caf\xc3\xa9\nsecond line");

  // Long words at the line's end stay whole: nothing is hyphenated.
  std::string man = ".TH FOO 1\n.SH NAME\nfoo \\- manword does things\n.SH DESCRIPTION\n";
  for (int i = 0; i < 20; ++i) man += "internationalization ";
  const std::string page =
      Run(ExtractManPage, dir_.Write("foo.1", man))["QUIXMDTextContent"].asString();
  EXPECT_NE(page.find("foo - manword does things"), std::string::npos) << page;
  EXPECT_EQ(page.find("-\n"), std::string::npos) << page;
  EXPECT_EQ(page.find('\x08'), std::string::npos);

  const std::string ps = dir_.Write("w.ps", kPostScript);
  EXPECT_NE(Run(ExtractPostScript, ps)["QUIXMDTextContent"].asString().find("Quokka lighthouse"),
            std::string::npos);

  // A DjVu page with a hidden text layer, as scanning software writes it.
  const std::string d = dir_.path();
  ASSERT_TRUE(
      Make("gs -q -dSAFER -dBATCH -dNOPAUSE -sDEVICE=pbmraw -r150 "
           "-dDEVICEWIDTHPOINTS=400 -dDEVICEHEIGHTPOINTS=120 -sOutputFile=" +
           d + "/w.pbm " + ps + " && cjb2 " + d + "/w.pbm " + d + "/w.djvu"));
  dir_.Write("t.txt",
             "(page 0 0 833 250 (line 10 10 600 80 (word 10 10 300 80 \"Wombat\") "
             "(word 310 10 600 80 \"djvuword\")))\n");
  ASSERT_TRUE(Make("djvused " + d + "/w.djvu -e 'select 1; set-txt " + d + "/t.txt' -s"));
  EXPECT_EQ(Run(ExtractDjvu, d + "/w.djvu")["QUIXMDTextContent"], "Wombat djvuword");

  // A file the converter rejects is an error, not an empty document.
  EXPECT_THROW(Run(ExtractDjvu, dir_.Write("bad.djvu", "AT&TFORM garbage")), std::exception);
}

TEST_F(ToolExtractTest, AMissingConverterLeavesTheFileUnreadWithOneLogLine) {
  const std::string rtf = dir_.Write("a.rtf", "{\\rtf1 text}");
  const std::string ps = dir_.Write("w.ps", kPostScript);
  const std::string saved = std::getenv("PATH");
  setenv("PATH", dir_.path().c_str(), 1);
  test::LogCapture log;
  Json::Value f1 = Run(ExtractRtf, rtf);
  Json::Value f2 = Run(ExtractRtf, rtf);
  Json::Value f3 = Run(ExtractPostScript, ps);
  setenv("PATH", saved.c_str(), 1);
  EXPECT_TRUE(f1.getMemberNames().empty() && f2.getMemberNames().empty() &&
              f3.getMemberNames().empty());
  EXPECT_EQ(log.Count("unrtf is not installed"), 1);
  EXPECT_EQ(log.Count("gs is not installed"), 1);
}

}  // namespace
}  // namespace extract
}  // namespace orvane
