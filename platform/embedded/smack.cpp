#include "platform_smack.h"

#include <cerrno>
#include <cstring>
#include <string>

#include "fault.h"
#include "state/labels.h"

namespace {

using embedded::LabelKind;
using embedded::Links;

LabelKind kind_of(smack_label_type type) {
  switch (type) {
    case SMACK_LABEL_EXEC:
      return LabelKind::kExec;
    case SMACK_LABEL_MMAP:
      return LabelKind::kMmap;
    case SMACK_LABEL_ACCESS:
      break;
  }
  return LabelKind::kAccess;
}

int get(const char *path, char **label, smack_label_type type, Links links) {
  if (path == nullptr || label == nullptr) {
    errno = EINVAL;
    return -1;
  }
  std::string text;
  if (embedded::read_label(path, links, kind_of(type), &text) != 0) return -1;
  *label = strdup(text.c_str());
  return *label == nullptr ? -1 : 0;
}

int set(const char *path, const char *label, smack_label_type type, Links links) {
  if (path == nullptr || label == nullptr) {
    errno = EINVAL;
    return -1;
  }
  return embedded::write_label(path, links, kind_of(type), label);
}

}  // namespace

int smack_getlabel(const char *path, char **label, smack_label_type type) {
  RETURN_FAULT();
  return get(path, label, type, Links::kFollow);
}

int smack_lgetlabel(const char *path, char **label, smack_label_type type) {
  RETURN_FAULT();
  return get(path, label, type, Links::kKeep);
}

int smack_setlabel(const char *path, const char *label, smack_label_type type) {
  RETURN_FAULT();
  return set(path, label, type, Links::kFollow);
}

int smack_lsetlabel(const char *path, const char *label, smack_label_type type) {
  RETURN_FAULT();
  return set(path, label, type, Links::kKeep);
}
