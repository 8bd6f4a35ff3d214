#include "extract/mail.hpp"

#include <glib.h>
#include <gtest/gtest.h>

#include <memory>

#include "extract/extractor_test_util.hpp"
#include "test/sample_files.hpp"

namespace orvane {
namespace extract {
namespace {

// A message as a mail program writes it: encoded headers, a Latin-1 quoted-printable body with
// an HTML alternative, and a base64 attachment.
const char kMessage[] =
    "From: =?ISO-8859-1?Q?Andr=E9?= <andre@example.org>\n"
    "To: Bob <bob@example.org>\n"
    "Cc: carol@example.org\n"
    "Subject: Quarterly =?ISO-8859-1?Q?r=E9sum=E9?=\n"
    "Date: Tue, 07 May 2024 09:08:09 +0000\n"
    "MIME-Version: 1.0\n"
    "Content-Type: multipart/mixed; boundary=\"b1\"\n"
    "\n"
    "--b1\n"
    "Content-Type: multipart/alternative; boundary=\"b2\"\n"
    "\n"
    "--b2\n"
    "Content-Type: text/plain; charset=iso-8859-1\n"
    "Content-Transfer-Encoding: quoted-printable\n"
    "\n"
    "Le caf=E9 est pr=EAt, mailbodyword.\n"
    "--b2\n"
    "Content-Type: text/html; charset=utf-8\n"
    "\n"
    "<html><body><p>htmlpartword</p><script>scriptword</script></body></html>\n"
    "--b2--\n"
    "--b1\n"
    "Content-Type: text/plain; name=\"notes.txt\"\n"
    "Content-Disposition: attachment; filename=\"notes.txt\"\n"
    "Content-Transfer-Encoding: base64\n"
    "\n"
    "YXR0YWNoZWR3b3JkIGluc2lkZQo=\n";

std::string Base64(const std::string& data) {
  std::unique_ptr<gchar, void (*)(gpointer)> text(
      g_base64_encode(reinterpret_cast<const guchar*>(data.data()), data.size()), g_free);
  return text.get();
}

using MailTest = ExtractorTest;

TEST_F(MailTest, HeadersBecomeFieldsAndEveryPartItsText) {
  // A PDF attached is read as a PDF; one that is damaged leaves its name.
  const std::string mail = std::string(kMessage) +
                           "--b1\nContent-Type: application/pdf\nContent-Disposition: attachment;"
                           " filename=\"report.pdf\"\nContent-Transfer-Encoding: base64\n\n" +
                           Base64(test::SamplePdf("Report", "pdfattachmentword")) +
                           "\n--b1\nContent-Type: application/pdf; name=\"broken.pdf\"\n"
                           "Content-Transfer-Encoding: base64\n\n" +
                           Base64("%PDF-1.4 cut") + "\n--b1--\n";
  const Json::Value f = Run(ExtractMessage, dir_.Write("m.eml", mail));
  EXPECT_EQ(f["QUIXMDAuthors"], "Andr\xc3\xa9 <andre@example.org>");
  EXPECT_EQ(f["QUIXMDRecipients"], "Bob <bob@example.org>, carol@example.org");
  EXPECT_EQ(f["QUIXMDTitle"], "Quarterly r\xc3\xa9sum\xc3\xa9");
  EXPECT_EQ(f["QUIXMDContentCreationDate"].asInt64(), 1715072889);
  const std::string text = f["QUIXMDTextContent"].asString();
  for (const char* want :
       {"caf\xc3\xa9 est pr\xc3\xaat, mailbodyword", "htmlpartword", "notes.txt",
        "attachedword inside", "report.pdf", "pdfattachmentword", "broken.pdf"}) {
    EXPECT_NE(text.find(want), std::string::npos) << want << " in " << text;
  }
  EXPECT_EQ(text.find("scriptword"), std::string::npos) << text;
}

TEST_F(MailTest, MailboxGivesEveryMessage) {
  const std::string mbox = "From andre@example.org Tue May  7 09:08:09 2024\n" +
                           std::string(kMessage) + "--b1--\n" +
                           "\nFrom dan@example.org Wed May  8 10:00:00 2024\n"
                           "From: Dan <dan@example.org>\nSubject: second note\n\n"
                           ">From the start, secondbodyword.\n";
  const Json::Value f = Run(ExtractMailbox, dir_.Write("inbox.mbox", mbox));
  const std::string text = f["QUIXMDTextContent"].asString();
  for (const char* want : {"mailbodyword", "attachedword", "Subject: second note",
                           "Dan <dan@example.org>", "secondbodyword"}) {
    EXPECT_NE(text.find(want), std::string::npos) << want << " in " << text;
  }
  // A mailbox has no one sender or subject.
  EXPECT_FALSE(f.isMember("QUIXMDTitle"));
  EXPECT_THROW(Run(ExtractMailbox, dir_.Write("not.mbox", "no mailbox here\n")), std::exception);
}

TEST_F(MailTest, TenThousandPartsStopAtThePartLimit) {
  std::string mail = "From: a@b\nSubject: many\nContent-Type: multipart/mixed; boundary=x\n\n";
  for (int i = 0; i < 10000; ++i) {
    mail += "--x\nContent-Type: text/plain\n\npart" + std::to_string(i) + "word\n";
  }
  mail += "--x--\n";
  const std::string text =
      Run(ExtractMessage, dir_.Write("many.eml", mail))["QUIXMDTextContent"].asString();
  EXPECT_NE(text.find("part0word"), std::string::npos);
  EXPECT_NE(text.find("part" + std::to_string(kMaxMailParts - 2) + "word"), std::string::npos);
  EXPECT_EQ(text.find("part9999word"), std::string::npos);
}

}  // namespace
}  // namespace extract
}  // namespace orvane
