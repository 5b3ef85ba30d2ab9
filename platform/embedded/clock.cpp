#include "platform_clock.h"

#include "state/clock.h"
#include "state/state_file.h"

int64_t platform_clock_offset_ms(void) {
  return embedded::clock_offset_ms(embedded::current_device());
}
