/**
 * @file quarn_handles.h
 * @brief Owners for C handles: the template, and those of the C library.
 *
 * Each alias is a std::unique_ptr that releases its handle with the function
 * that belongs to it. UniqueFd does the same for a file descriptor. Those of
 * the other libraries stand apart, with what they include: glib_handles.h,
 * gio_handles.h, json_ptr.h.
 */
#ifndef QUARN_HANDLES_H
#define QUARN_HANDLES_H

#include <dirent.h>

#include <cstdlib>
#include <memory>

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

#endif
