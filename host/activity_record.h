// What the host writes to the activity log (platform/activity): every call
// of a module method that changes something, and every sign-in, with the
// caller's account and address. Reads are never recorded.
//
// Only the values of an allow-list of parameter names are recorded (ids,
// versions, volumes, feed lists with any credentials in their addresses
// removed, setting values); passwords, tokens, session ids and cookies are
// never among them. A failure to record is logged to syslog and the call
// goes on.
#pragma once

#include <string>
#include <sys/types.h>

#include "activity/activity_log.h"
#include "webapi/api_request.h"
#include "webapi/api_response.h"

// True when api/method changes something and so is recorded.
bool IsRecordedMethod(const std::string& api, const std::string& method);

// The activity entry of one call, begun when made for a recorded method and
// finished by Finish. A process forked by the handler never finishes it: the
// answer of the process that began it is the outcome.
class CallRecord {
 public:
  // `account` is the caller, as the session proved it.
  CallRecord(const APIRequest& request, const std::string& account);
  // An entry still open here was cut short by an exception in the handler,
  // which the host answers with 100.
  ~CallRecord();
  CallRecord(const CallRecord&) = delete;
  CallRecord& operator=(const CallRecord&) = delete;

  void Finish(const APIResponse& response);

 private:
  KivoActivity::ActivityLog log_;
  long long id_ = 0;
  pid_t pid_ = 0;
};

// Records a sign-in attempt for `account` as typed (never the password) from
// the caller's address, with the answer it got.
void RecordSignIn(const std::string& account, const APIResponse& response);

// The outcome an answer gives: its code (0 for success) and the reason or
// message it carries, if any.
KivoActivity::Outcome OutcomeOf(const APIResponse& response);

// The client's address as the web server gives it (REMOTE_ADDR), "" if none.
std::string ClientAddress();
