#include "module/methods/methods_test_support.h"

#include <gtest/gtest.h>

#include <sstream>

#include "host/provision.h"
#include "module/frame/table.h"
#include "zeph/json_file.h"

namespace ZEPH {
namespace test {

ApplianceRoot::ApplianceRoot() {
  std::string error;
  EXPECT_TRUE(ProvisionRoot(&error)) << error;
}

CallResult ApplianceRoot::Call(const std::string& api, const std::string& method,
                               const Json::Value& params) const {
  CallResult result;
  for (const ZEPH_API_TABLE* row = GetAPITable(); row->api != nullptr; ++row) {
    if (api == row->api && method == row->method) {
      APIRequest request(params);
      row->handler(&request, &result.response);
      EXPECT_EQ(result.response.outcome_count(), 1) << api << " " << method;
      return result;
    }
  }
  ADD_FAILURE() << "no row " << api << " " << method;
  return result;
}

CallResult ApplianceRoot::Call(const std::string& api, const std::string& method,
                               const std::string& params) const {
  Json::Value value;
  EXPECT_TRUE(JsonParse(params, value)) << params;
  return Call(api, method, value);
}

std::vector<Json::Value> ApplianceRoot::Events() const {
  std::vector<Json::Value> events;
  std::istringstream in(ReadFile(Path("/var/log/zeph/events.jsonl")));
  for (std::string line; std::getline(in, line);) {
    events.emplace_back();
    EXPECT_TRUE(JsonParse(line, events.back())) << line;
  }
  return events;
}

Json::Value ApplianceRoot::Info() const {
  Json::Value info;
  EXPECT_TRUE(JsonFromFile(info, Archive("/INFO")));
  return info;
}

Json::Value ApplianceRoot::WebService() const {
  Json::Value services;
  EXPECT_TRUE(JsonFromFile(services, Archive("/SERVICES")));
  return services[0];
}

std::string ApplianceRoot::CreateCertificate(const std::string& common_name,
                                             const Json::Value& extra) const {
  Json::Value params = CreateParams(common_name);
  for (const std::string& key : extra.getMemberNames()) params[key] = extra[key];
  CallResult r = Call("ZEPH.Core.Certificate.CRT", "create", params);
  EXPECT_TRUE(r.ok()) << r.code();
  return r.data()["id"].asString();
}

Json::Value CreateParams(const std::string& common_name) {
  Json::Value p(Json::objectValue);
  for (const std::string x : {"ca_", ""}) {
    p[x + "country"] = "TW";
    p[x + "city"] = "Taipel";
    p[x + "organization"] = "Zeph Test";
    p[x + "state"] = p[x + "department"] = p[x + "email"] = "";
    p[x + "key_length"] = 1024;
  }
  p["ca_common_name"] = common_name + " CA";
  p["common_name"] = common_name;
  p["desc"] = "made by a test";
  return p;
}

}  // namespace test
}  // namespace ZEPH
