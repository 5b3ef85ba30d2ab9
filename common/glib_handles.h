/**
 * @file glib_handles.h
 * @brief Owners for GLib's handles, used as those of quarn_handles.h.
 */
#ifndef GLIB_HANDLES_H
#define GLIB_HANDLES_H

#include <glib.h>

#include "quarn_handles.h"

/** A text that GLib has made. */
using GText = Handle<char, &g_free>;
using GErrorPtr = Handle<GError, &g_error_free>;
using GVariantPtr = Handle<GVariant, &g_variant_unref>;
using GMainLoopPtr = Handle<GMainLoop, &g_main_loop_unref>;

/** Receives an error through an out pointer, as CStringOut a text. */
class GErrorOut {
 public:
  explicit GErrorOut(GErrorPtr &owner) : owner_(owner) {}
  ~GErrorOut() { owner_.reset(raw_); }
  GErrorOut(const GErrorOut &) = delete;
  GErrorOut &operator=(const GErrorOut &) = delete;
  operator GError **() { return &raw_; }  // NOLINT: meant to be passed as an argument

 private:
  GErrorPtr &owner_;
  GError *raw_ = nullptr;
};
inline GErrorOut out(GErrorPtr &owner) { return GErrorOut(owner); }

#endif
