// JSON text of a test case as a value; a typo in a test's JSON fails the test
// instead of silently becoming null.
#ifndef TC_TEST_JSON_H
#define TC_TEST_JSON_H

#include <memory>
#include <string>

#include <gtest/gtest.h>
#include <json/json.h>

inline Json::Value J(const std::string& text) {
  Json::Value out;
  std::string errors;
  std::unique_ptr<Json::CharReader> reader(Json::CharReaderBuilder().newCharReader());
  if (!reader->parse(text.data(), text.data() + text.size(), &out, &errors))
    ADD_FAILURE() << "bad JSON in test: " << text << ": " << errors;
  return out;
}

#endif
