// The event log file, /quorvan/spool/log/keymgr.events: always replaced whole
// (a new file of the running user's, mode 0644), never written into, so that
// a file another account planted at its path stays untouched and theirs no
// longer.
#pragma once

#include <span>

#include "util/status.h"
#include "verdict/event_log.h"

namespace keymgr::verdict {

// WriteEventLog replaces the log with |events|, one record a line.
Status WriteEventLog(std::span<const Event> events);

// AppendEvent replaces the log with its records so far and |event| after
// them, numbered next. A log that cannot be read, or holds anything but
// records, keeps none of it: the file says only what this process knows.
Status AppendEvent(Event event);

}  // namespace keymgr::verdict
