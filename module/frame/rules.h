// Parameter rules of the method wrappers.
//
// A wrapper lists the parameters it demands as ParamRule entries; the list
// becomes the platform's rule object
//   {"field": {<name>: {"type": <code>, "necessary": <bool>}}}
// which ParameterChecker::check validates the request against.
#ifndef ZEPH_MODULE_FRAME_RULES_H_
#define ZEPH_MODULE_FRAME_RULES_H_

#include <json/json.h>

#include <initializer_list>

#include "zeph/api.h"
#include "zeph/parameter_checker.h"

namespace ZEPH {
namespace frame {

struct ParamRule {
  const char* name;
  int type;  // PARAM_TYPE_* code of the platform checker
  bool necessary;
};

// Adds the rules to `rule_object` in list order; a null value becomes an
// object on the first rule.
void AddRules(Json::Value& rule_object, std::initializer_list<ParamRule> rules);

// True when `request` satisfies every rule of the list.
bool CheckRules(APIRequest* request, std::initializer_list<ParamRule> rules);

}  // namespace frame
}  // namespace ZEPH

#endif  // ZEPH_MODULE_FRAME_RULES_H_
