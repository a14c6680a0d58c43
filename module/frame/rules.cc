#include "module/frame/rules.h"

namespace ZEPH {
namespace frame {

void AddRules(Json::Value& rule_object, std::initializer_list<ParamRule> rules) {
  for (const ParamRule& rule : rules) {
    rule_object["field"][rule.name]["type"] = rule.type;
    rule_object["field"][rule.name]["necessary"] = rule.necessary;
  }
}

bool CheckRules(APIRequest* request, std::initializer_list<ParamRule> rules) {
  Json::Value rule_object;
  AddRules(rule_object, rules);
  return ParameterChecker::check(request, rule_object);
}

}  // namespace frame
}  // namespace ZEPH
