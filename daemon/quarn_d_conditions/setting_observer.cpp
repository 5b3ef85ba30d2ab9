#include "quarn_d_conditions/setting_observer.h"

namespace {

void (*setting_observer)() = nullptr;

}  // namespace

void set_setting_observer(void (*observer)()) { setting_observer = observer; }

void tell_setting_observer() {
  if (setting_observer != nullptr) setting_observer();
}
