// Reduces engaged-visit (CBA) records of a session to how well the visited
// address matches a web result the search showed for the same query, and
// drops those that match nothing. The visited address itself is always
// removed: it never leaves the device.
//
// One pass over the feedback in list order. Visible-results feedback adds the
// punchout addresses of its results from the sections "vireon.web_index" and
// "vireon.web_suggest" to its query's candidates; a CBA engagement gets the
// best `cbaMatchBetween` (url_matching.h) of its visited address against the
// candidates gathered so far for its query, and is kept only when that is
// above 0. Everything else passes unchanged. Holds no state; make one per
// session, on the work queue.
#pragma once

#include "corevireon.pb.h"

#include <google/protobuf/repeated_ptr_field.h>

namespace fbf {

class CBAFilterController {
 public:
  using FeedbackList = google::protobuf::RepeatedPtrField<corevireon::CVFeedbackPayload>;

  // The filtered list (the input is consumed).
  FeedbackList arrayOfCBAFilteredFeedback(FeedbackList feedback) const;
  // The same, rewriting the list in place; kept payloads keep their order.
  void filter(FeedbackList& feedback) const;
};

}  // namespace fbf
