// "fileindexctl doctor": looks for what would stop indexing (daemons that do not answer, too few
// inotify watches for the indexed trees, missing share folders, a full volume, a stale index)
// and says for each what to do. Reads only; not thread-safe (it reads the platform seam and the
// process's ORVANE_ROOT).
#ifndef ORVANE_TOOLS_FILEINDEXCTL_DOCTOR_HPP_
#define ORVANE_TOOLS_FILEINDEXCTL_DOCTOR_HPP_

#include <json/json.h>

#include <ostream>

namespace orvane {
namespace ctl {

// {"ok": bool, "findings": [{"check", "level": "ok"|"note"|"problem", "message", "action"}]};
// "ok" is false when some finding is a problem.
Json::Value Diagnose();

// One line per finding, the problems first, then a closing verdict.
void PrintDiagnosis(const Json::Value& diagnosis, std::ostream& os);

}  // namespace ctl
}  // namespace orvane

#endif  // ORVANE_TOOLS_FILEINDEXCTL_DOCTOR_HPP_
