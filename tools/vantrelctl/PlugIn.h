#pragma once
// Plug-ins as the tool names and shows them: PLUGIN arguments (identifier,
// UUID or bundle path) resolved through "explain", and the fields of a
// plug-in form that the tables show.

#include <optional>
#include <string>
#include <string_view>

#include "base/Uuid.h"
#include "lmo/Value.h"
#include "tools/vantrelctl/Session.h"

namespace vantrel::ctl {

// The key of a plug-in's extension point inside the form's "info" (the
// plug-in's extension dictionary). The model names it in a header below the
// client layer, so the tool spells it once here.
inline constexpr std::string_view kExtensionPointKey = "QXExtensionPointIdentifier";

// A PLUGIN argument: a path when it starts with "/" or "." (made absolute),
// a UUID when it parses as one, else an identifier. The "explain" selector
// that names it: {"path": ...}, {"uuid": ...} or {"identifier": ...}.
lmo::Dictionary selectorFor(const std::string& plugIn);

// The explanation of the one registration plugIn names, explained with the
// extra keys of request (host, rules, flags; may be empty).
struct Resolution {
  std::optional<lmo::Dictionary> explanation;  // set on success
  int status = 0;                              // the exit status on failure
};
// Failures print their message: the daemon unreachable or refusing; nothing
// registered ("vantrelctl: <the daemon's text>", e.g. "no plug-in X is installed");
// several registrations (each candidate's UUID, version and path, and a
// request to name one by UUID or path).
Resolution resolvePlugIn(Session& session, const std::string& plugIn,
                         const lmo::Dictionary& request = {});

// Table fields of a form.
std::string formPoint(const lmo::Dictionary& form);
std::string formWhere(const lmo::Dictionary& form);
// The election in a form's annotations, 0 when none.
int64_t formElection(const lmo::Dictionary& form);

}  // namespace vantrel::ctl
