// A web API module whose methods misbehave on purpose, so that the host's
// handling of each kind of answer can be exercised.
#include <chrono>
#include <condition_variable>
#include <mutex>
#include <stdexcept>

#include "orvi_api.h"

namespace {

void Echo(ORVI::APIRequest* request, ORVI::APIResponse* response) {
  Json::Value data(Json::objectValue);
  data["version"] = 1;
  data["value"] = request->GetParam("value", Json::Value());
  response->SetSuccess(data);
}

void EchoV2(ORVI::APIRequest* request, ORVI::APIResponse* response) {
  Json::Value data(Json::objectValue);
  data["version"] = 2;
  data["value"] = request->GetParam("value", Json::Value());
  response->SetSuccess(data);
}

void Fail(ORVI::APIRequest*, ORVI::APIResponse* response) {
  response->SetError(4242, Json::Value());
}

void FailTwiceAlike(ORVI::APIRequest*, ORVI::APIResponse* response) {
  response->SetError(1201, Json::Value());
  response->SetError(1201, Json::Value());
}

void Conflict(ORVI::APIRequest*, ORVI::APIResponse* response) {
  response->SetError(1201, Json::Value());
  response->SetSuccess(Json::Value());
}

void Silent(ORVI::APIRequest*, ORVI::APIResponse*) {}

void ThrowStd(ORVI::APIRequest*, ORVI::APIResponse*) {
  throw std::runtime_error("boom\nsecond line");
}

void ThrowOther(ORVI::APIRequest*, ORVI::APIResponse*) { throw 7; }

void ThrowJson(ORVI::APIRequest* request, ORVI::APIResponse*) {
  // Indexing a number by a key throws inside JsonCpp.
  request->GetParam("value", Json::Value(5))["member"].asInt();
}

// Succeeds only when two requests are inside at once: proves that the
// server runs requests concurrently without timing anything.
std::mutex gMeetMutex;
std::condition_variable gMeetCv;
int gInside = 0;

void Meet(ORVI::APIRequest*, ORVI::APIResponse* response) {
  std::unique_lock<std::mutex> lock(gMeetMutex);
  ++gInside;
  gMeetCv.notify_all();
  bool met = gMeetCv.wait_for(lock, std::chrono::seconds(10), [] { return gInside >= 2; });
  if (met) {
    response->SetSuccess(Json::Value(true));
  } else {
    --gInside;
    response->SetError(1, Json::Value());
  }
}

const char kApi[] = "Test.Host";

const APITableEntry kTable[] = {
    {kApi, 1, "echo", Echo},
    {kApi, 2, "echo", EchoV2},
    {kApi, 1, "fail", Fail},
    {kApi, 1, "fail-twice", FailTwiceAlike},
    {kApi, 1, "conflict", Conflict},
    {kApi, 1, "silent", Silent},
    {kApi, 1, "throw", ThrowStd},
    {kApi, 1, "throw-other", ThrowOther},
    {kApi, 1, "throw-json", ThrowJson},
    {kApi, 1, "meet", Meet},
    // Rows that can never be dispatched are skipped, not taken for the end.
    {nullptr, 1, "orphan", Echo},
    {kApi, 1, "no-handler", nullptr},
    {kApi, 1, "after-gaps", Echo},
    {nullptr, 0, nullptr, nullptr},
};

}  // namespace

extern "C" const APITableEntry* GetAPITable(void) {
#ifdef TEST_MODULE_NULL_TABLE
  (void)kTable;
  return nullptr;
#else
  return kTable;
#endif
}
