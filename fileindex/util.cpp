#include "fileindex/util.hpp"

#include <boost/algorithm/string/classification.hpp>
#include <boost/algorithm/string/split.hpp>
#include <climits>
#include <cstdlib>
#include <cstring>
#include <vector>

#include "common/error.hpp"
#include "common/sdk/share.hpp"
#include "platform/config.hpp"
#include "platform/fs.hpp"
#include "platform/share.hpp"

namespace orvane {
namespace fileindex {

using namespace orvane::platform;  // NOLINT: the platform calls read as the platform names them
using std::string;

namespace {

constexpr char kSnapshotMarker[] = "#snapshot";
constexpr char kRecycleMarker[] = "#recycle";
constexpr char kHomesShare[] = "homes";
// The platform's flag set for "is this path in an existing, enabled home recycle bin".
constexpr int kHomeRecycleFlags = 11;
// The platform's code for kernel-made file systems, never indexed beside image file systems.
constexpr int kPseudoFsType = 12;

const std::vector<string>& PreservedNames() {
  static const std::vector<string> names = {
      ".QUIXPPSDB", ".TemporaryItems", ".Spotlight-V100", ".DocumentRevisions-V100",
      ".HFS+ Private Directory Data", ".Trashes", ".fseventsd", ".Maildir", ".git",
      ".DS_Store", "Thumbs.db"};
  return names;
}

}  // namespace

void GetShareNameByPath(string& share_name, const string& share_path) {
  ORVANE_THROW_IF(1 > share_path.size() || '/' != share_path.at(0), kErrInvalidParam, share_path);
  const size_t end = share_path.find('/', 1);
  share_name = share_path.substr(1, end == string::npos ? string::npos : end - 1);
}

string GetShareNameByPath(const string& share_path) {
  string share_name;
  GetShareNameByPath(share_name, share_path);
  return share_name;
}

void GetFullPath(string& full_path, const string& share_path) {
  const string share_name = GetShareNameByPath(share_path);
  sdk::SDKShare share(share_name);
  const string volume_path = share.GetPath();
  // The share's folder bears the share's name, so its parent plus the share path is the path.
  full_path = volume_path.substr(0, volume_path.rfind('/')) + share_path;
}

string GetFullPath(const string& share_path) {
  string full_path;
  GetFullPath(full_path, share_path);
  return full_path;
}

void GetShareNamePathByFullPath(string& share_name, string& share_path, const string& full_path) {
  char szShareName[492];
  char szSharePath[4096];
  memset(szShareName, 0, sizeof(szShareName));
  memset(szSharePath, 0, sizeof(szSharePath));
  ORVANE_THROW_IF(0 > QUIXShareNamePathGet(full_path.c_str(), szShareName, sizeof(szShareName),
                                           szSharePath, sizeof(szSharePath)),
                  kErrSystem, "QUIXShareNamePathGet failed, full_path=" + full_path);
  share_name = szShareName;
  share_path = szSharePath;
}

string ReplacePathShare(const string& path, const string& new_share, const string& old_share) {
  const size_t pos = (path + "/").find("/" + old_share + "/");
  ORVANE_THROW_IF(string::npos == pos, kErrInvalidParam, "Cannot find share: " + old_share);
  return path.substr(0, pos + 1) + new_share + path.substr(pos + 1 + old_share.size());
}

bool IsFullPathInRecycleBin(const string& full_path) {
  string share_name;
  string share_path;
  GetShareNamePathByFullPath(share_name, share_path, full_path);
  if (full_path.find(kRecycleMarker) != string::npos &&
      QUIXShareIsShareRecycle(full_path.c_str()) == 1) {
    return true;
  }
  return share_name == kHomesShare &&
         QUIXRecycleUserHomePathIsExist(full_path.c_str(), kHomeRecycleFlags) == 1;
}

bool IsSystemPreservedFileName(const string& name) {
  if (QUIXEAIsHiddenDir(name.c_str()) == 1) return true;
  for (const string& preserved : PreservedNames()) {
    if (name == preserved) return true;
  }
  return false;
}

bool CanFullPathBeIndexed(const string& full_path) {
  // Every rule below judges against one view of the share configuration.
  platform::ScopedConfigSnapshot config_snapshot;
  if (full_path.find(kSnapshotMarker) != string::npos) {
    int in_snapshot = 0;
    if (QLIBFhsPathInSnapshot(full_path.c_str(), &in_snapshot) == 0 && in_snapshot == 1) {
      return false;
    }
  }

  const int fs_type = QUIXGetFSType(full_path.c_str(), 0);
  if (fs_type < 0) return false;
  if (QUIXFSIsRemoteFS(fs_type) != 0) return false;
  if (QUIXFSIsImageFS(fs_type) != 0 || fs_type == kPseudoFsType) return false;

  string share_name;
  string share_path;
  GetShareNamePathByFullPath(share_name, share_path, full_path);
  sdk::SDKShare share(share_name);
  if (!share.CanBeIndexed()) return false;

  if (IsFullPathInRecycleBin(full_path)) return false;

  // An unlocked encrypted share is mounted on its own root, so its mount points are its own.
  if (QUIXFSDirIsMntPoint(full_path.c_str()) == 1 && !share.IsEncryption()) return false;

  std::vector<string> components;
  boost::algorithm::split(components, full_path, boost::algorithm::is_any_of("/"));
  for (const string& component : components) {
    if (IsSystemPreservedFileName(component)) return false;
  }

  char real[4096];
  if (realpath(full_path.c_str(), real) == nullptr) return false;
  return full_path == real;
}

bool CanPathBeIndexed(const string& share_path) {
  return CanFullPathBeIndexed(GetFullPath(share_path));
}

FileType GetFileTypeByFullPath(const string& full_path) {
  return GetFileTypeByExtension(GetFileExtension(full_path, true));
}

FileType GetFileTypeByExtension(const string& ext) {
  const std::map<string, FileType>& table = FileTypeTable();
  auto it = table.find(ext);
  return it == table.end() ? kOther : it->second;
}

const std::vector<string>& GetExtensionsOfType(FileType type) {
  static const std::vector<std::vector<string>> by_type = [] {
    std::vector<std::vector<string>> lists(kOther + 1);
    // The table is ordered, so each list comes out in byte order.
    for (const auto& entry : FileTypeTable()) lists[entry.second].push_back(entry.first);
    return lists;
  }();
  return by_type[type >= kDocument && type < kOther ? type : kOther];
}

namespace {
const char* const kFileTypeSettings[] = {"document", "audio", "video", "photo"};
}  // namespace

const char* GetFileTypeSetting(FileType type) {
  return type >= kDocument && type < kOther ? kFileTypeSettings[type] : nullptr;
}

FileType GetFileTypeBySetting(const string& name) {
  for (int type = kDocument; type < kOther; ++type) {
    if (name == kFileTypeSettings[type]) return static_cast<FileType>(type);
  }
  return kOther;
}

namespace {

constexpr FileType D = kDocument;
constexpr FileType A = kAudio;
constexpr FileType V = kVideo;
constexpr FileType P = kPhoto;

}  // namespace

// "prc" is listed twice and kept once.
const std::map<string, FileType>& FileTypeTable() {
  static const std::map<string, FileType> table = {
      {"", D}, {"!!!", D}, {"$00", D}, {"$01", D}, {"$02", D}, {"$04", D}, {"$05", D}, {"$o1", D},
      {"$ol", D}, {"1", D}, {"12da", D}, {"1st", D}, {"7", D}, {"7z", D}, {"82t", D}, {"92t", D},
      {"_me", D}, {"abap", D}, {"abl", D}, {"ac", D}, {"ada", D}, {"adiumhtmllog", D},
      {"adiumlog", D}, {"adl", D}, {"adt", D}, {"adw", D}, {"ahk", D}, {"aiml", D}, {"alx", D},
      {"aml", D}, {"android", D}, {"annot", D}, {"ans", D}, {"ansi", D}, {"application", D},
      {"aprj", D}, {"apx", D}, {"aqt", D}, {"arff", D}, {"artask", D}, {"as", D}, {"asc", D},
      {"ascii", D}, {"asl", D}, {"asp", D}, {"ass", D}, {"assoc", D}, {"atc", D}, {"att", D},
      {"awa", D}, {"awb", D}, {"awd", D}, {"awh", D}, {"awp", D}, {"axt", D}, {"azw3", D}, {"ba1", D},
      {"bad", D}, {"bas", D}, {"bat", D}, {"bbs", D}, {"bbxt", D}, {"bcr", D}, {"bdp", D}, {"bdr", D},
      {"bea", D}, {"bel", D}, {"bep", D}, {"big", D}, {"big5", D}, {"bk", D}, {"blm", D}, {"bln", D},
      {"blw", D}, {"bmtp", D}, {"bna", D}, {"bnx", D}, {"bog", D}, {"box", D}, {"bpdx", D},
      {"brf", D}, {"bsdl", D}, {"bss", D}, {"bt", D}, {"bz2", D}, {"bzw", D}, {"c", D}, {"cag", D},
      {"cas", D}, {"cascii", D}, {"cbl", D}, {"cc", D}, {"cd2", D}, {"cfm", D}, {"charset", D},
      {"chm", D}, {"cho", D}, {"chord", D}, {"cif", D}, {"cil", D}, {"ckn", D}, {"clg", D},
      {"cli", D}, {"clix", D}, {"clj", D}, {"cmd", D}, {"cmtx", D}, {"cof", D}, {"coffee", D},
      {"conf", D}, {"coo", D}, {"cpp", D}, {"crash", D}, {"crd", D}, {"cs", D}, {"csassembly", D},
      {"csmanifest", D}, {"css", D}, {"csv", D}, {"ctd", D}, {"ctf", D}, {"ctl", D}, {"ctx", D},
      {"d", D}, {"dart", D}, {"dcd", D}, {"dce", D}, {"ddd", D}, {"ddt", D}, {"de", D},
      {"dectest", D}, {"des", D}, {"desc", D}, {"dfe", D}, {"dfm", D}, {"diff", D}, {"dii", D},
      {"diskdefines", D}, {"diz", D}, {"dk", D}, {"dkz", D}, {"dmr", D}, {"dne", D}, {"doc", D},
      {"docm", D}, {"docx", D}, {"dok", D}, {"dot", D}, {"dotm", D}, {"dotx", D}, {"dp", D},
      {"dpv", D}, {"dqy", D}, {"drp", D}, {"dsc", D}, {"dsml", D}, {"dtd", D}, {"dwl", D},
      {"ecsv", D}, {"edml", D}, {"edn", D}, {"edt", D}, {"efm", D}, {"eia", D}, {"ejs", D},
      {"eml", D}, {"emulecollection", D}, {"en", D}, {"enc", D}, {"enf", D}, {"eng", D}, {"epub", D},
      {"erl", D}, {"err", D}, {"es", D}, {"esw", D}, {"etf", D}, {"etx", D}, {"euc", D}, {"ext", D},
      {"extra", D}, {"f", D}, {"faq", D}, {"fff", D}, {"ffp", D}, {"fin", D}, {"first", D},
      {"flr", D}, {"fmr", D}, {"fnx", D}, {"fon", D}, {"forth", D}, {"fr", D}, {"fra", D}, {"frm", D},
      {"fsa", D}, {"fth", D}, {"ftl", D}, {"full", D}, {"gbf", D}, {"gdt", D}, {"gen", D}, {"ger", D},
      {"glsl", D}, {"gnu", D}, {"gnumeric", D}, {"go", D}, {"gpl", D}, {"groovy", D}, {"gs", D},
      {"gthr", D}, {"gtx", D}, {"guide", D}, {"gz", D}, {"haml", D}, {"handlebars", D}, {"hdr", D},
      {"hhc", D}, {"hhs", D}, {"hlm", D}, {"hlx", D}, {"hp8", D}, {"hs", D}, {"hsk", D}, {"ht3", D},
      {"htm", D}, {"html", D}, {"htmls", D}, {"htx", D}, {"hvc", D}, {"hwl", D}, {"hx", D}, {"hz", D},
      {"id31", D}, {"id32", D}, {"idc", D}, {"idt", D}, {"idx", D}, {"iem", D}, {"igv", D},
      {"igy", D}, {"iif", D}, {"inc", D}, {"ini", D}, {"inuse", D}, {"ion", D}, {"ipr", D},
      {"iqy", D}, {"isr", D}, {"it", D}, {"ivp", D}, {"ja", D}, {"jack", D}, {"jad", D}, {"jade", D},
      {"jam", D}, {"java", D}, {"jeb", D}, {"jis", D}, {"jl", D}, {"jp1", D}, {"js", D}, {"json", D},
      {"jsp", D}, {"jss", D}, {"jsx", D}, {"jtx", D}, {"kahl", D}, {"kar", D}, {"kch", D}, {"key", D},
      {"kix", D}, {"klg", D}, {"kor", D}, {"la", D}, {"label", D}, {"las", D}, {"latex", D},
      {"lay", D}, {"less", D}, {"lin", D}, {"linux", D}, {"linx", D}, {"liquid", D}, {"lisp", D},
      {"lit", D}, {"lnc", D}, {"lo_", D}, {"log", D}, {"lrc", D}, {"ls", D}, {"lsl", D}, {"lst", D},
      {"ltr", D}, {"ltt", D}, {"ltx", D}, {"lua", D}, {"lue", D}, {"luf", D}, {"lwd", D},
      {"lxfml", D}, {"lyr", D}, {"lyt", D}, {"m", D}, {"man", D}, {"manifest", D}, {"map", D},
      {"mar", D}, {"markdown", D}, {"mathml", D}, {"maxfr", D}, {"mcw", D}, {"md", D}, {"mdl", D},
      {"mdle", D}, {"mdown", D}, {"mdtext", D}, {"mdtxt", D}, {"mdwn", D}, {"me", D}, {"mez", D},
      {"mf", D}, {"mib", D}, {"mit", D}, {"mk", D}, {"mkd", D}, {"mkdn", D}, {"mno", D}, {"mnu", D},
      {"mobi", D}, {"modd", D}, {"mpsub", D}, {"msg", D}, {"mss", D}, {"mtx", D}, {"mtxt", D},
      {"mvg", D}, {"mw", D}, {"mysql", D}, {"nbr", D}, {"nclk", D}, {"ncm", D}, {"new", D},
      {"nfo", D}, {"nix", D}, {"nlc", D}, {"nmbd", D}, {"nokogiri", D}, {"not", D}, {"notes", D},
      {"now", D}, {"npdt", D}, {"nt", D}, {"numbers", D}, {"nwctxt", D}, {"ocaml", D}, {"ocr", D},
      {"odb", D}, {"odc", D}, {"odf", D}, {"odg", D}, {"odi", D}, {"odm", D}, {"odoc", D}, {"odp", D},
      {"ods", D}, {"odt", D}, {"oh", D}, {"ojp", D}, {"omn", D}, {"oogl", D}, {"oot", D}, {"opc", D},
      {"openbsd", D}, {"opml", D}, {"ort", D}, {"osheet", D}, {"osi", D}, {"oslides", D}, {"otc", D},
      {"otf", D}, {"otg", D}, {"oth", D}, {"oti", D}, {"otp", D}, {"ots", D}, {"ott", D}, {"p3x", D},
      {"pages", D}, {"panic", D}, {"pascal", D}, {"pbd", D}, {"pc5", D}, {"pcl", D}, {"pd", D},
      {"pdb", D}, {"pdf", D}, {"pdu", D}, {"perl", D}, {"pfs", D}, {"pgw", D}, {"php", D}, {"pjs", D},
      {"pl", D}, {"pla", D}, {"plf", D}, {"plg", D}, {"plist", D}, {"plk", D}, {"pln", D}, {"pml", D},
      {"pmo", D}, {"pod", D}, {"pot", D}, {"potm", D}, {"potx", D}, {"ppa", D}, {"pps", D},
      {"ppsm", D}, {"ppsx", D}, {"ppt", D}, {"pptm", D}, {"pptx", D}, {"prc", D}, {"prc", D},
      {"prn", D}, {"pro", D}, {"prr", D}, {"ps", D}, {"psb", D}, {"psi2", D}, {"pt3", D}, {"pts", D},
      {"pvj", D}, {"pvw", D}, {"py", D}, {"q&a", D}, {"qdt", D}, {"qud", D}, {"r", D}, {"rar", D},
      {"rb", D}, {"rbdf", D}, {"rbw", D}, {"rdf", D}, {"rea", D}, {"readme", D}, {"reg", D},
      {"rel", D}, {"rep", D}, {"resp", D}, {"rest", D}, {"rff", D}, {"rhtml", D}, {"ris", D},
      {"rml", D}, {"rqy", D}, {"rs", D}, {"rst", D}, {"rt", D}, {"rtf", D}, {"rtl", D}, {"rtx", D},
      {"ru", D}, {"rus", D}, {"rzk", D}, {"rzn", D}, {"s", D}, {"s19", D}, {"s2k", D}, {"sami", D},
      {"sass", D}, {"sbv", D}, {"scad", D}, {"scala", D}, {"scm", D}, {"scss", D}, {"sct", D},
      {"sdnf", D}, {"sen", D}, {"seq", D}, {"set", D}, {"sfb", D}, {"sgp", D}, {"sh", D}, {"sha1", D},
      {"sha512", D}, {"sjs", D}, {"skcard", D}, {"skv", D}, {"slk", D}, {"sls", D}, {"smali", D},
      {"smf", D}, {"smi", D}, {"sms", D}, {"snw", D}, {"soap", D}, {"soundscript", D}, {"spa", D},
      {"spec", D}, {"spg", D}, {"spn", D}, {"spx", D}, {"sql", D}, {"srt", D}, {"srx", D}, {"ss", D},
      {"ssa", D}, {"ssf", D}, {"st1", D}, {"stf", D}, {"stq", D}, {"strings", D}, {"styl", D},
      {"sub", D}, {"syn", D}, {"t", D}, {"t2t", D}, {"tab", D}, {"tar", D}, {"tbd", D}, {"tbl", D},
      {"tbx", D}, {"tbz", D}, {"tce", D}, {"tcl", D}, {"tcm", D}, {"tdf", D}, {"ted", D}, {"tex", D},
      {"text", D}, {"textclipping", D}, {"textile", D}, {"tfw", D}, {"tgf", D}, {"tgz", D},
      {"thml", D}, {"thp", D}, {"tlb", D}, {"tle", D}, {"tlx", D}, {"tm", D}, {"tml", D},
      {"tmprtf", D}, {"tmx", D}, {"tnef", D}, {"tph", D}, {"tpl", D}, {"trn", D}, {"trt", D},
      {"tsv", D}, {"tt", D}, {"ttbl", D}, {"tte", D}, {"ttpl", D}, {"ttxt", D}, {"tx8", D},
      {"tx?", D}, {"txa", D}, {"txd", D}, {"txe", D}, {"txh", D}, {"txt", D}, {"u3i", D}, {"uax", D},
      {"uhtml", D}, {"uk", D}, {"unauth", D}, {"uni", D}, {"unx", D}, {"us", D}, {"usa", D},
      {"user", D}, {"usf", D}, {"usg", D}, {"utf8", D}, {"utx", D}, {"utxt", D}, {"v", D}, {"vb", D},
      {"ver", D}, {"vet", D}, {"vfk", D}, {"vhd", D}, {"vhdl", D}, {"vis", D}, {"vkp", D}, {"vmg", D},
      {"vmsg", D}, {"vna", D}, {"vsmproj", D}, {"vw", D}, {"vw3", D}, {"vxml", D}, {"wer", D},
      {"wir", D}, {"wkf", D}, {"wn", D}, {"wrd", D}, {"wrl", D}, {"wsc", D}, {"wst", D}, {"wtf", D},
      {"wtl", D}, {"wtx", D}, {"x20", D}, {"x60", D}, {"x70", D}, {"x80", D}, {"x90", D}, {"xb0", D},
      {"xc0", D}, {"xct", D}, {"xd0", D}, {"xdl", D}, {"xdp", D}, {"xfd", D}, {"xff", D}, {"xhtm", D},
      {"xlf", D}, {"xls", D}, {"xlsm", D}, {"xlsx", D}, {"xlt", D}, {"xltm", D}, {"xltx", D},
      {"xml", D}, {"xq", D}, {"xquery", D}, {"xqy", D}, {"xsd", D}, {"xsl", D}, {"xslt", D},
      {"xsr", D}, {"xwp", D}, {"xy", D}, {"xy3", D}, {"xyp", D}, {"xyw", D}, {"xyz", D}, {"yaml", D},
      {"yml", D}, {"zanebug", D}, {"zed", D}, {"zhp", D}, {"zib", D}, {"zip", D}, {"zw", D},
      {"zxe", D}, {"aac", A}, {"ac3", A}, {"aif", A}, {"aiff", A}, {"ape", A}, {"cue", A}, {"dff", A},
      {"dsf", A}, {"flac", A}, {"m3u", A}, {"m4a", A}, {"m4b", A}, {"m4p", A}, {"mp1", A}, {"mp2", A},
      {"mp3", A}, {"mpa", A}, {"ogg", A}, {"pcm", A}, {"pls", A}, {"ra", A}, {"ram", A}, {"wav", A},
      {"wma", A}, {"wpl", A}, {"3g2", V}, {"3gp", V}, {"asf", V}, {"avi", V}, {"dat", V}, {"divx", V},
      {"dvr-ms", V}, {"f4v", V}, {"flv", V}, {"ifo", V}, {"iso", V}, {"m2t", V}, {"m2ts", V},
      {"m4v", V}, {"mkv", V}, {"mov", V}, {"mp4", V}, {"mpeg", V}, {"mpg", V}, {"mts", V}, {"qt", V},
      {"rm", V}, {"rmvb", V}, {"swf", V}, {"tp", V}, {"trp", V}, {"ts", V}, {"vdr", V}, {"vob", V},
      {"wmv", V}, {"xvid", V}, {"3fr", P}, {"arw", P}, {"bmp", P}, {"cr2", P}, {"crw", P}, {"dcr", P},
      {"dng", P}, {"erf", P}, {"gif", P}, {"ico", P}, {"jpe", P}, {"jpeg", P}, {"jpg", P}, {"k25", P},
      {"kdc", P}, {"mef", P}, {"mos", P}, {"mrw", P}, {"nef", P}, {"orf", P}, {"pef", P}, {"png", P},
      {"psd", P}, {"ptx", P}, {"raf", P}, {"raw", P}, {"rw2", P}, {"sr2", P}, {"srf", P}, {"tif", P},
      {"tiff", P}, {"ufo", P}, {"x3f", P},
  };
  return table;
}

namespace {
// Built while the library loads, so that no lookup pays for it.
[[maybe_unused]] const std::map<string, FileType>& kBuiltAtLoad = FileTypeTable();
[[maybe_unused]] const std::vector<string>& kListsBuiltAtLoad = GetExtensionsOfType(kDocument);
}  // namespace

}  // namespace fileindex
}  // namespace orvane
