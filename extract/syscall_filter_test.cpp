#include "extract/syscall_filter.hpp"

#include <dirent.h>
#include <fcntl.h>
#include <gtest/gtest.h>
#include <pwd.h>
#include <signal.h>
#include <spawn.h>
#include <sys/ioctl.h>
#include <sys/mman.h>
#include <sys/ptrace.h>
#include <sys/socket.h>
#include <sys/stat.h>
#include <sys/wait.h>
#include <taglib/tag.h>
#include <taglib/wavfile.h>
#include <unistd.h>

#include <cerrno>
#include <cstdlib>
#include <cstring>
#include <exiv2/exiv2.hpp>
#include <fstream>
#include <functional>
#include <map>
#include <sstream>
#include <thread>

#include "common/json_util.hpp"
#include "extract/content.hpp"
#include "extract/extract_runner.hpp"
#include "test/sample_files.hpp"
#include "test/test_util.hpp"

extern char** environ;

namespace orvane {
namespace extract {
namespace {

// 0 when the call succeeded, else its errno.
int Outcome(bool ok) { return ok ? 0 : errno; }

// The exit status of a program started from the confined process (-1: it did not start).
int Spawned(std::vector<const char*> argv) {
  argv.push_back(nullptr);
  pid_t pid;
  if (posix_spawn(&pid, argv[0], nullptr, nullptr, const_cast<char**>(argv.data()), environ) != 0) {
    return -1;
  }
  int status = 0;
  waitpid(pid, &status, 0);
  return WIFEXITED(status) ? WEXITSTATUS(status) : 128 + WTERMSIG(status);
}

// Runs each probe in one confined child and returns what each gave (0 or an errno), by name.
std::map<std::string, int> ProbeConfined(
    const std::vector<std::pair<std::string, std::function<int()>>>& probes) {
  int fds[2];
  EXPECT_EQ(0, pipe(fds));
  const pid_t child = fork();
  if (child == 0) {
    close(fds[0]);
    std::string error;
    std::string out;
    if (!ConfineExtractionHelper(&error)) {
      out = "confine " + error + "\n";
    } else {
      for (const auto& [name, probe] : probes) out += name + " " + std::to_string(probe()) + "\n";
    }
    (void)!write(fds[1], out.data(), out.size());
    _exit(0);
  }
  close(fds[1]);
  std::string text;
  char buf[4096];
  for (ssize_t n; (n = read(fds[0], buf, sizeof(buf))) > 0;) text.append(buf, n);
  close(fds[0]);
  int status = 0;
  waitpid(child, &status, 0);
  EXPECT_TRUE(WIFEXITED(status) && WEXITSTATUS(status) == 0) << "status " << status;
  std::map<std::string, int> results;
  std::istringstream lines(text);
  for (std::string name, value; lines >> name >> value;) {
    EXPECT_NE(name, "confine") << text;
    results[name] = std::atoi(value.c_str());
  }
  return results;
}

// Everything reading a file and replying needs works; writing, creating, removing, networking,
// tracing and signalling others do not, for the helper and for any program it starts. A root
// helper still reads a file only its owner may read.
TEST(SyscallFilterTest, TheConfinedHelperReadsAndRepliesAndDoesNothingElse) {
  test::TempDir dir;
  const std::string file = dir.Write("input.txt", "contents");
  const std::string victim = dir.Write("victim.txt", "keep me");
  const std::string created = dir.Path("created");
  const std::string secret = dir.Write("secret.txt", "private");
  chmod(secret.c_str(), 0600);
  const bool root = geteuid() == 0;
  if (root) {
    const struct passwd* nobody = getpwnam("nobody");
    ASSERT_NE(nobody, nullptr);
    ASSERT_EQ(0, chown(secret.c_str(), nobody->pw_uid, nobody->pw_gid));
  }
  int reply[2];
  ASSERT_EQ(0, pipe(reply));

  auto read_all = [](const std::string& path) {
    const int fd = open(path.c_str(), O_RDONLY | O_CLOEXEC | O_NOFOLLOW);
    if (fd < 0) return errno;
    char buf[64];
    const ssize_t n = read(fd, buf, sizeof(buf));
    close(fd);
    return n > 0 ? 0 : EIO;
  };
  const std::map<std::string, int> got = ProbeConfined({
      {"read", [&] { return read_all(file); }},
      {"read_others_private_file", [&] { return read_all(secret); }},
      {"list", [&] { return Outcome(opendir(dir.path().c_str()) != nullptr); }},
      {"reply", [&] { return Outcome(write(reply[1], "{}\n", 3) == 3); }},
      {"memory_file", [&] {
         const int fd = memfd_create("member", MFD_CLOEXEC);
         return Outcome(fd >= 0 && write(fd, "x", 1) == 1);
       }},
      {"thread", [&] {
         bool ran = false;
         std::thread([&] { ran = true; }).join();
         return ran ? 0 : EIO;
       }},
      {"run_converter", [&] { return Spawned({"/bin/true"}) == 0 ? 0 : EIO; }},
      {"isatty", [&] { return isatty(reply[1]) == 0 && errno == ENOTTY ? 0 : errno; }},
      {"open_for_writing", [&] { return Outcome(open(victim.c_str(), O_WRONLY) >= 0); }},
      {"open_read_write", [&] { return Outcome(open(victim.c_str(), O_RDWR) >= 0); }},
      {"truncate_on_open", [&] { return Outcome(open(victim.c_str(), O_RDONLY | O_TRUNC) >= 0); }},
      {"create", [&] { return Outcome(open(created.c_str(), O_RDONLY | O_CREAT, 0600) >= 0); }},
      {"unnamed_file", [&] { return Outcome(open(dir.path().c_str(), O_TMPFILE | O_RDWR) >= 0); }},
      {"unlink", [&] { return Outcome(unlink(victim.c_str()) == 0); }},
      {"rename", [&] { return Outcome(rename(victim.c_str(), created.c_str()) == 0); }},
      {"mkdir", [&] { return Outcome(mkdir(created.c_str(), 0700) == 0); }},
      {"chmod", [&] { return Outcome(chmod(victim.c_str(), 0666) == 0); }},
      {"inet_socket", [&] { return Outcome(socket(AF_INET, SOCK_STREAM, 0) >= 0); }},
      {"signal_everyone", [&] { return Outcome(kill(-1, 0) == 0); }},
      {"signal_init", [&] { return Outcome(kill(1, 0) == 0); }},
      {"new_namespace", [&] { return Outcome(unshare(CLONE_NEWUSER) == 0); }},
      {"become_another_user", [&] { return Outcome(setuid(12345) == 0); }},
      {"fake_terminal_input", [&] {
         char c = 'x';
         return Outcome(ioctl(0, TIOCSTI, &c) == 0);
       }},
      // A program it starts is held to the same rules: the shell cannot create the file.
      {"converter_writes", [&] {
         const std::string script = "echo x > " + created;
         return Spawned({"/bin/sh", "-c", script.c_str()}) == 0 ? 0 : EPERM;
       }},
  });
  for (const char* allowed : {"read", "list", "reply", "memory_file", "thread", "run_converter",
                              "isatty"}) {
    EXPECT_EQ(got.at(allowed), 0) << allowed << ": " << std::strerror(got.at(allowed));
  }
  // Root keeps the right to read any file, for the shares' files of every user.
  EXPECT_EQ(got.at("read_others_private_file"), 0);
  for (const char* refused :
       {"open_for_writing", "open_read_write", "truncate_on_open", "create", "unnamed_file",
        "unlink", "rename", "mkdir", "chmod", "inet_socket", "signal_everyone", "signal_init",
        "new_namespace", "become_another_user", "fake_terminal_input", "converter_writes"}) {
    EXPECT_NE(got.at(refused), 0) << refused << " was allowed";
  }
  EXPECT_EQ(got.at("open_for_writing"), EPERM);
  EXPECT_EQ(test::ReadFile(victim), "keep me");
  EXPECT_NE(access(created.c_str(), F_OK), 0);
  close(reply[0]);
  close(reply[1]);
}

// The real helper, confined, extracts files of every kind exactly as the same code does
// unconfined in this process.
TEST(SyscallFilterTest, TheConfinedHelperExtractsEveryKindAsTheUnconfinedCodeDoes) {
  test::TempDir dir;
  std::vector<std::string> files = {
      dir.Write("utf8.txt", "Grüße aus der Datei\n"),
      dir.Write("latin1.txt", std::string("caf\xe9 cr\xe8" "me br\xfb" "l\xe9" "e et encore")),
      dir.Write("page.html", "<html><head><title>T</title></head><body><p>web page</p></body></html>"),
      dir.Write("report.pdf", test::SamplePdf("Quarterly Report", "Hello searchable world")),
      dir.Write("noise.bin", std::string("\x01\x02\x03\x00\xff", 5)),
      dir.Path("w.docx"),
      dir.Path("t.odt"),
      dir.Write("song.wav", test::SampleWav(1, 8000, 1)),
      dir.Write("photo.png", test::SamplePng(4, 3)),
  };
  ASSERT_TRUE(test::WriteSampleZip(
      dir.Path("w.docx"),
      {{"[Content_Types].xml", "<Types/>"},
       {"word/document.xml",
        "<w:document xmlns:w=\"w\"><w:body><w:p><w:r><w:t>word text</w:t></w:r></w:p>"
        "</w:body></w:document>"},
       {"docProps/core.xml",
        "<cp:coreProperties xmlns:cp=\"c\" xmlns:dc=\"d\"><dc:title>Plan</dc:title>"
        "</cp:coreProperties>"}}));
  ASSERT_TRUE(test::WriteSampleZip(
      dir.Path("t.odt"),
      {{"mimetype", "application/vnd.oasis.opendocument.text"},
       {"content.xml",
        "<office:document-content xmlns:text=\"t\" xmlns:office=\"o\"><office:body>"
        "<text:p>open document</text:p></office:body></office:document-content>"}}));
  {
    TagLib::RIFF::WAV::File wav(dir.Path("song.wav").c_str());
    wav.ID3v2Tag()->setTitle("Song");
    ASSERT_TRUE(wav.save());
    auto image = Exiv2::ImageFactory::open(dir.Path("photo.png"));
    image->readMetadata();
    Exiv2::ExifData exif;
    exif["Exif.Image.Make"] = "Maker";
    image->setExifData(exif);
    image->writeMetadata();
  }
  // Kinds read through the converters the helper runs, and text recognition in an image.
  files.push_back(dir.Write("plan.rtf", "{\\rtf1\\ansi{\\info{\\title Plan}}\\pard rtfword\\par}"));
  files.push_back(dir.Write("foo.1", ".TH FOO 1\n.SH NAME\nfoo \\- manword does things\n"));
  const std::string ps = dir.Write(
      "w.ps", "%!PS\n/Helvetica findfont 40 scalefont setfont\n30 40 moveto (Quokka lighthouse) "
              "show\nshowpage\n");
  files.push_back(ps);
  const std::string gs = "gs -q -dSAFER -dBATCH -dNOPAUSE -r150 -dDEVICEWIDTHPOINTS=400 "
                         "-dDEVICEHEIGHTPOINTS=120 ";
  ASSERT_EQ(0, std::system((gs + "-sDEVICE=pnggray -sOutputFile=" + dir.Path("words.png") + " " +
                            ps + " && " + gs + "-sDEVICE=pbmraw -sOutputFile=" +
                            dir.Path("w.pbm") + " " + ps + " && cjb2 " + dir.Path("w.pbm") + " " +
                            dir.Path("w.djvu"))
                               .c_str()));
  // The DjVu page gets the hidden text layer scanning software writes.
  dir.Write("t.txt", "(page 0 0 833 250 (line 10 10 600 80 (word 10 10 300 80 \"Wombat\")))\n");
  ASSERT_EQ(0, std::system(("djvused " + dir.Path("w.djvu") + " -e 'select 1; set-txt " +
                            dir.Path("t.txt") + "' -s")
                               .c_str()));
  files.push_back(dir.Path("words.png"));
  files.push_back(dir.Path("w.djvu"));
  files.push_back(dir.Write("m.eml", "From: Bob <bob@example.org>\nSubject: Plan\n"
                                     "Content-Type: text/plain\n\nmailbodyword\n"));
  files.push_back(dir.Write("inbox.mbox", "From bob@example.org Tue May  7 09:08:09 2024\n"
                                          "From: Bob <bob@example.org>\nSubject: One\n\nfirst\n\n"
                                          "From carol@example.org Tue May  7 09:08:10 2024\n"
                                          "From: Carol <carol@example.org>\nSubject: Two\n\nsecond\n"));
  files.push_back(dir.Write("notes.xml", "<?xml version=\"1.0\"?><notes><n>xmlword</n></notes>"));
  // Files of the system itself, whatever kinds it has.
  for (const char* system_file : {"/usr/share/common-licenses/GPL-3", "/usr/share/common-licenses/Apache-2.0"}) {
    if (access(system_file, R_OK) == 0) files.push_back(system_file);
  }

  setenv("FILEINDEX_EXTRACT_HELPER", EXTRACT_HELPER_BINARY, 1);
  for (const std::string& path : files) {
    Json::Value expected;
    try {
      expected = ExtractContent(path);
    } catch (const std::exception& e) {
      ADD_FAILURE() << path << " cannot be extracted even unconfined: " << e.what();
      continue;
    }
    Json::Value fields;
    std::string error;
    ASSERT_TRUE(RunExtractHelper(path, &fields, &error)) << path << ": " << error;
    EXPECT_EQ(JsonToString(fields), JsonToString(expected)) << path;
    EXPECT_FALSE(fields.empty() && path.find("noise") == std::string::npos) << path;
  }
  CloseIdleExtractHelpers();
  unsetenv("FILEINDEX_EXTRACT_HELPER");
}

}  // namespace
}  // namespace extract
}  // namespace orvane
