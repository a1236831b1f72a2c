// The fixture of a test that calls the web API through the real host as the
// administrator, on a system root of its own, and the few helpers such tests
// share.
#pragma once

#include <memory>
#include <mutex>
#include <string>

#include <gtest/gtest.h>
#include <json/value.h>

#include "testing/cgi_client.h"
#include "testing/temp_root.h"

class AdminApiTest : public ::testing::Test {
 protected:
  // Adds the administrator "admin" (password "secret") to the new root.
  AdminApiTest();

  // The administrator's client, signed in on the first call (so after SetUp
  // has configured the root) and kept for the rest of the test. Threads of
  // a test may make that first call at once: one of them signs in.
  const ApiClient& client();
  // Makes kivoinfo.conf hold nothing but the package source trust level.
  void Trust(int level) const;

  TempRoot root_;

 private:
  std::once_flag signed_in_;
  std::unique_ptr<ApiClient> client_;
};

// Polls Installation "status" of `task_id` every 50 ms until the task is
// finished or `tries` answers said it was not; returns the last answer.
CgiAnswer WaitTaskFinished(const ApiClient& client, const std::string& task_id, int tries = 200);

// The entry of `id` in the "data" list of a catalogue answer ("Server"
// "list"); null when it lists none.
Json::Value CatalogueEntry(const CgiAnswer& list, const std::string& id);

// `value` as JSON text, quoted again as a JSON string: the form of a
// parameter that holds JSON, such as a feed's "list".
std::string ListParam(const Json::Value& value);
