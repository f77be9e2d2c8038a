#include "env_check.h"

namespace {

class LateCheck : public EnvCheck {
 public:
    std::string handle(TERN::HA::Daemon::Status&) override { return "better late than never"; }
    std::string getType() override { return "late_check"; }
};

const CheckerRegister<LateCheck> registration("late_check");

}  // namespace
