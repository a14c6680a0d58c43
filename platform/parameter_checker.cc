#include "zeph/parameter_checker.h"

bool ParameterChecker::matches(const Json::Value& value, int type_code) {
  switch (type_code) {
    case PARAM_TYPE_STRING:
      return value.isString();
    case PARAM_TYPE_BOOL:
      return value.isBool();
    case PARAM_TYPE_STRING_ARRAY:
      if (!value.isArray()) return false;
      for (const Json::Value& element : value) {
        if (!element.isString()) return false;
      }
      return true;
    case PARAM_TYPE_OBJECT_ARRAY:
      // The elements are the method's to judge: a worker reports a bad
      // element per element instead of refusing the whole request.
      return value.isArray();
    case PARAM_TYPE_INT:
      // jsoncpp calls an integral real such as 5.0 an int too; only an
      // integer literal counts here.
      return (value.type() == Json::intValue ||
              value.type() == Json::uintValue) &&
             value.isInt();
    default:
      return false;
  }
}

bool ParameterChecker::check(ZEPH::APIRequest* request,
                             const Json::Value& rules) {
  if (request == nullptr || !rules.isObject()) return false;
  const Json::Value& fields = rules["field"];
  if (!fields.isObject()) return false;
  for (const std::string& name : fields.getMemberNames()) {
    const Json::Value& rule = fields[name];
    if (!rule.isObject() || !rule["type"].isInt() ||
        !rule["necessary"].isBool()) {
      return false;
    }
    if (!request->HasParam(name)) {
      if (rule["necessary"].asBool()) return false;
      continue;
    }
    if (!matches(request->GetParam(name, Json::Value()), rule["type"].asInt())) {
      return false;
    }
  }
  return true;
}
