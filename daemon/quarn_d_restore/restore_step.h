/**
 * @file restore_step.h
 * @brief The steps of a restore by name, for tests that come in between.
 */
#ifndef QUARN_D_RESTORE_RESTORE_STEP_H
#define QUARN_D_RESTORE_RESTORE_STEP_H

#include "quarn_d_utils/package_identity.h"

/** Told the name of each step of a restore; null but in tests. */
extern void (*restore_step_hook)(const char *step);
inline void restore_step(const char *step) {
  if (restore_step_hook == nullptr) return;
  const ActAsRoot root;
  restore_step_hook(step);
}

#endif
