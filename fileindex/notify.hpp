// The administrators' desktop notifications live in common/notify.hpp, below the request
// channel that sends one when the search engine stays busy; this name is kept for the library's
// own includes.
#ifndef ORVANE_FILEINDEX_NOTIFY_HPP_
#define ORVANE_FILEINDEX_NOTIFY_HPP_

#include "common/notify.hpp"

#endif  // ORVANE_FILEINDEX_NOTIFY_HPP_
