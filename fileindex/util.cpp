#include "fileindex/util.hpp"

#include <boost/algorithm/string/classification.hpp>
#include <boost/algorithm/string/split.hpp>
#include <climits>
#include <cstdlib>
#include <cstring>
#include <sstream>
#include <utility>
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

// The extensions of each kind, split on white space. The empty extension (a name without a dot)
// counts as a document and is added on its own; "prc" is listed twice and kept once.
const char kDocumentExtensions[] = R"(
!!! $00 $01 $02 $04 $05 $o1 $ol 1 12da 1st 7 7z 82t 92t _me abap abl ac ada adiumhtmllog adiumlog
adl adt adw ahk aiml alx aml android annot ans ansi application aprj apx aqt arff artask as asc
ascii asl asp ass assoc atc att awa awb awd awh awp axt azw3 ba1 bad bas bat bbs bbxt bcr bdp bdr
bea bel bep big big5 bk blm bln blw bmtp bna bnx bog box bpdx brf bsdl bss bt bz2 bzw c cag cas
cascii cbl cc cd2 cfm charset chm cho chord cif cil ckn clg cli clix clj cmd cmtx cof coffee conf
coo cpp crash crd cs csassembly csmanifest css csv ctd ctf ctl ctx d dart dcd dce ddd ddt de
dectest des desc dfe dfm diff dii diskdefines diz dk dkz dmr dne doc docm docx dok dot dotm dotx
dp dpv dqy drp dsc dsml dtd dwl ecsv edml edn edt efm eia ejs eml emulecollection en enc enf eng
epub erl err es esw etf etx euc ext extra f faq fff ffp fin first flr fmr fnx fon forth fr fra frm
fsa fth ftl full gbf gdt gen ger glsl gnu gnumeric go gpl groovy gs gthr gtx guide gz haml
handlebars hdr hhc hhs hlm hlx hp8 hs hsk ht3 htm html htmls htx hvc hwl hx hz id31 id32 idc idt
idx iem igv igy iif inc ini inuse ion ipr iqy isr it ivp ja jack jad jade jam java jeb jis jl jp1
js json jsp jss jsx jtx kahl kar kch key kix klg kor la label las latex lay less lin linux linx
liquid lisp lit lnc lo_ log lrc ls lsl lst ltr ltt ltx lua lue luf lwd lxfml lyr lyt m man
manifest map mar markdown mathml maxfr mcw md mdl mdle mdown mdtext mdtxt mdwn me mez mf mib mit
mk mkd mkdn mno mnu mobi modd mpsub msg mss mtx mtxt mvg mw mysql nbr nclk ncm new nfo nix nlc
nmbd nokogiri not notes now npdt nt numbers nwctxt ocaml ocr odb odc odf odg odi odm odoc odp ods
odt oh ojp omn oogl oot opc openbsd opml ort osheet osi oslides otc otf otg oth oti otp ots ott
p3x pages panic pascal pbd pc5 pcl pd pdb pdf pdu perl pfs pgw php pjs pl pla plf plg plist plk
pln pml pmo pod pot potm potx ppa pps ppsm ppsx ppt pptm pptx prc prc prn pro prr ps psb psi2 pt3
pts pvj pvw py q&a qdt qud r rar rb rbdf rbw rdf rea readme reg rel rep resp rest rff rhtml ris
rml rqy rs rst rt rtf rtl rtx ru rus rzk rzn s s19 s2k sami sass sbv scad scala scm scss sct sdnf
sen seq set sfb sgp sh sha1 sha512 sjs skcard skv slk sls smali smf smi sms snw soap soundscript
spa spec spg spn spx sql srt srx ss ssa ssf st1 stf stq strings styl sub syn t t2t tab tar tbd tbl
tbx tbz tce tcl tcm tdf ted tex text textclipping textile tfw tgf tgz thml thp tlb tle tlx tm tml
tmprtf tmx tnef tph tpl trn trt tsv tt ttbl tte ttpl ttxt tx8 tx? txa txd txe txh txt u3i uax
uhtml uk unauth uni unx us usa user usf usg utf8 utx utxt v vb ver vet vfk vhd vhdl vis vkp vmg
vmsg vna vsmproj vw vw3 vxml wer wir wkf wn wrd wrl wsc wst wtf wtl wtx x20 x60 x70 x80 x90 xb0
xc0 xct xd0 xdl xdp xfd xff xhtm xlf xls xlsm xlsx xlt xltm xltx xml xq xquery xqy xsd xsl xslt
xsr xwp xy xy3 xyp xyw xyz yaml yml zanebug zed zhp zib zip zw zxe
)";

const char kAudioExtensions[] = R"(
aac ac3 aif aiff ape cue dff dsf flac m3u m4a m4b m4p mka mp1 mp2 mp3 mpa oga ogg opus pcm pls ra
ram wav weba wma wpl
)";

const char kVideoExtensions[] = R"(
3g2 3gp asf avi dat divx dvr-ms f4v flv ifo iso m2t m2ts m4v mkv mov mp4 mpeg mpg mts ogv qt rm
rmvb swf tp trp ts vdr vob webm wmv xvid
)";

const char kPhotoExtensions[] = R"(
3fr arw avif bmp cr2 crw dcr dng erf gif heic heif ico jpe jpeg jpg jxl k25 kdc mef mos mrw nef
orf pef png psd ptx raf raw rw2 sr2 srf tif tiff ufo webp x3f
)";

}  // namespace

const std::map<string, FileType>& FileTypeTable() {
  static const std::map<string, FileType> table = [] {
    std::map<string, FileType> t = {{"", kDocument}};
    const std::pair<const char*, FileType> lists[] = {{kDocumentExtensions, kDocument},
                                                      {kAudioExtensions, kAudio},
                                                      {kVideoExtensions, kVideo},
                                                      {kPhotoExtensions, kPhoto}};
    // An extension listed under two kinds keeps the first.
    for (const auto& list : lists) {
      std::istringstream words(list.first);
      for (string ext; words >> ext;) t.emplace(ext, list.second);
    }
    return t;
  }();
  return table;
}

namespace {
// Built while the library loads, so that no lookup pays for it.
[[maybe_unused]] const std::map<string, FileType>& kBuiltAtLoad = FileTypeTable();
[[maybe_unused]] const std::vector<string>& kListsBuiltAtLoad = GetExtensionsOfType(kDocument);
}  // namespace

}  // namespace fileindex
}  // namespace orvane
