// Validation of request parameters against a rule object.
//
// A rule object is {"field": {<name>: {"type": <code>, "necessary": <bool>}}}.
// A request satisfies it when, for every member of "field", the parameter is
// present if "necessary" is true and, when present, of the kind of "type":
//
//   4   string                 5   boolean
//   8   array of strings       13  array (of objects; the elements are the
//                                  method's to judge)
//   15  integer (fits in a signed 32-bit int)
//
// A rule with any other type code, or a malformed rule object, fails.
// The checker never writes the response.
#ifndef ZEPH_PARAMETER_CHECKER_H_
#define ZEPH_PARAMETER_CHECKER_H_

#include <json/json.h>

#include "zeph/api.h"
#include "zeph/export.h"

enum {
  PARAM_TYPE_STRING = 4,
  PARAM_TYPE_BOOL = 5,
  PARAM_TYPE_STRING_ARRAY = 8,
  PARAM_TYPE_OBJECT_ARRAY = 13,
  PARAM_TYPE_INT = 15,
};

class ZEPH_EXPORT ParameterChecker {
 public:
  static bool check(ZEPH::APIRequest* request, const Json::Value& rules);
  // Whether `value` is of the kind that `type_code` names.
  static bool matches(const Json::Value& value, int type_code);
};

#endif  // ZEPH_PARAMETER_CHECKER_H_
