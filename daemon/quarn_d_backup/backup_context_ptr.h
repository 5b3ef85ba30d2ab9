/**
 * @file backup_context_ptr.h
 * @brief A reference to the state of a run, for those who hold one and need not see it.
 */
#ifndef QUARN_D_BACKUP_CONTEXT_PTR_H
#define QUARN_D_BACKUP_CONTEXT_PTR_H

#include <memory>

struct backup_context;

/** Releases one reference. */
struct backup_context_unref {
  void operator()(backup_context *ctx) const;
};
using BackupContextPtr = std::unique_ptr<backup_context, backup_context_unref>;

#endif
