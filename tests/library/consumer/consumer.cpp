// A program that uses the installed client library the way an application would; it
// needs no daemon. Exit status 0 when every check holds.
#include <telvane/Telvane.h>
#include <telvane/TelvaneFunctions.h>
#include <telvane/TelvaneKeys.h>
#include <telvane/telvane.h>

#include <cstdio>


int main() {
  using namespace telvane;
  int failures = 0;
  auto check = [&](bool ok, const char* what) {
    if (!ok) {
      std::fprintf(stderr, "consumer: failed: %s\n", what);
      ++failures;
    }
  };

  Value root = TelvaneNewHierarchyTokenFromParentToken(Value());
  check(root["level"].integerValue() == 0 && root["token"].isString(), "a root token");
  Value child = Telvane::newHierarchyTokenFromParentToken(root);
  check(child["level"].integerValue() == 1 && child["token"] == root["token"], "a child token");

  Error error;
  Value sessionInfo(Dictionary{{"ComponentType", Value(4)}, {"SessionID", Value(1)}});
  auto session = Telvane::create(sessionInfo, Value(), Value(), nullptr, &error);
  check(session == nullptr, "component type 4 makes no session");
  check(error.domain == "TelvaneErrorDomain" && error.code == Error::kCodeComponentTypeInvalid, "error code 3");

  check(telvane_version() != nullptr && *telvane_version() != '\0', "the library's version");
  if (failures == 0) std::printf("consumer: ok (library %s, token %s)\n", telvane_version(),
                                 root["token"].stringOrEmpty().c_str());
  return failures == 0 ? 0 : 1;
}
