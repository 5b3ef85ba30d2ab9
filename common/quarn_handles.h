/**
 * @file quarn_handles.h
 * @brief Owners for the C handles of the libraries and the platform.
 *
 * Each alias is a std::unique_ptr that releases its handle with the function
 * that belongs to it. UniqueFd does the same for a file descriptor.
 */
#ifndef QUARN_HANDLES_H
#define QUARN_HANDLES_H

#include <dirent.h>
#include <gio/gio.h>
#include <glib.h>
#include <json-c/json.h>
#include <unistd.h>

#include <cstdlib>
#include <memory>
#include <type_traits>
#include <utility>

#include "unique_fd.h"

/** Calls @p Release on the pointer. */
template <auto Release>
struct Releaser {
  template <typename T>
  void operator()(T *handle) const {
    static_cast<void>(Release(handle));
  }
};

template <typename T, auto Release>
using Handle = std::unique_ptr<T, Releaser<Release>>;

/** A text from malloc(), as the platform gives them. */
using CString = Handle<char, &std::free>;
/** A text that GLib has made. */
using GText = Handle<char, &g_free>;
using GErrorPtr = Handle<GError, &g_error_free>;
using GDirPtr = Handle<GDir, &g_dir_close>;
using GVariantPtr = Handle<GVariant, &g_variant_unref>;
using GMainLoopPtr = Handle<GMainLoop, &g_main_loop_unref>;
using MessagePtr = Handle<GDBusMessage, &g_object_unref>;
using NodeInfoPtr = Handle<GDBusNodeInfo, &g_dbus_node_info_unref>;
/** A call that nobody has answered yet: answering it takes it. */
using InvocationPtr = Handle<GDBusMethodInvocation, &g_object_unref>;
using JsonPtr = Handle<json_object, &json_object_put>;
using DirPtr = Handle<DIR, &closedir>;

/** Receives a malloc'd text through an out pointer: `get(handle, out(text))`. */
class CStringOut {
 public:
  explicit CStringOut(CString &owner) : owner_(owner) {}
  ~CStringOut() { owner_.reset(raw_); }
  CStringOut(const CStringOut &) = delete;
  CStringOut &operator=(const CStringOut &) = delete;
  operator char **() { return &raw_; }  // NOLINT: meant to be passed as an argument

 private:
  CString &owner_;
  char *raw_ = nullptr;
};
inline CStringOut out(CString &owner) { return CStringOut(owner); }

/** The same for a GError. */
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
