/**
 * @file quarn_d_methods.h
 * @brief The methods of the interface "org.orvane.Quarn": the one table of their names, arguments,
 * answers and of who may call them.
 *
 * The introspection document, the rights, the bounds of arguments and the dispatcher's table of
 * handlers are made from it, or do not compile without it. docs/dbus.md tells clients the same.
 * Any thread.
 */
#ifndef QUARN_D_METHODS_H
#define QUARN_D_METHODS_H

#include <glib.h>

#include <cstddef>
#include <cstdint>
#include <optional>
#include <string>

/** The arguments of a call, by name; those that its method does not have are as they are here. */
struct quarn_arguments {
  std::int32_t activation = 0;
  std::int32_t on = 0;
  std::int32_t client = -1;
  const char *serial_num = nullptr; /**< this text and the others: the arguments' own */
  const char *pkg_list = nullptr;
  const char *pkg_id = nullptr;
  const char *param = nullptr;
  std::uint32_t req_id = 0;
};

/** One argument: its name, its D-Bus type, and where it is read to. */
struct quarn_argument {
  const char *name = nullptr;
  char type = '\0';
  std::int32_t quarn_arguments::*integer = nullptr;
  std::uint32_t quarn_arguments::*number = nullptr;
  const char *quarn_arguments::*text = nullptr;

  constexpr quarn_argument() = default;
  constexpr quarn_argument(const char *called, std::int32_t quarn_arguments::*field)
      : name(called), type('i'), integer(field) {}
  constexpr quarn_argument(const char *called, std::uint32_t quarn_arguments::*field)
      : name(called), type('u'), number(field) {}
  constexpr quarn_argument(const char *called, const char *quarn_arguments::*field)
      : name(called), type('s'), text(field) {}
};

inline constexpr quarn_argument kActivation{"activation", &quarn_arguments::activation};
inline constexpr quarn_argument kOn{"on", &quarn_arguments::on};
inline constexpr quarn_argument kClient{"client", &quarn_arguments::client};
inline constexpr quarn_argument kSerialNum{"serial_num", &quarn_arguments::serial_num};
inline constexpr quarn_argument kPkgList{"pkg_list", &quarn_arguments::pkg_list};
inline constexpr quarn_argument kPkgId{"pkg_id", &quarn_arguments::pkg_id};
inline constexpr quarn_argument kParam{"param", &quarn_arguments::param};
inline constexpr quarn_argument kReqId{"req_id", &quarn_arguments::req_id};

/** What a method replies. */
struct quarn_answer {
  const char *name = nullptr; /**< null: nothing */
  char type = '\0';
};
inline constexpr quarn_answer kRet{"ret", 'i'};
inline constexpr quarn_answer kTimestamp{"timestamp", 't'};
inline constexpr quarn_answer kEmptyAnswer{};

/** Who may call a method beside root and the members of the clients' group. */
enum class method_rights {
  trusted,        /**< nobody */
  own_package,    /**< applications, for their own package */
  as_companion,   /**< the companion, as client 1 */
  companions_mode /**< the same, but while a restore mode is on that is not the companion's it may
                     not switch off */
};

inline constexpr std::size_t kMostArguments = 5;

struct quarn_method {
  const char *name;
  quarn_argument arguments[kMostArguments + 1]; /**< the last has no name */
  quarn_answer answer;
  method_rights rights;
};

/** In the order of the introspection document. */
inline constexpr quarn_method kQuarnMethods[] = {
    {"set_activation", {kActivation}, kRet, method_rights::trusted},
    {"backup_enable", {kOn}, kRet, method_rights::trusted},
    {"restore_enable",
     {kOn, kClient, kSerialNum, kPkgList, kReqId},
     kRet,
     method_rights::companions_mode},
    {"last_bu_time", {}, kTimestamp, method_rights::trusted},
    {"get_app_list", {kClient, kReqId}, kRet, method_rights::as_companion},
    {"auto_backup_start", {kParam}, kEmptyAnswer, method_rights::trusted},
    {"manual_backup_start", {kReqId}, kRet, method_rights::trusted},
    {"manual_backup_cancel", {kReqId}, kRet, method_rights::trusted},
    {"app_data_backup_start", {kPkgId, kReqId}, kRet, method_rights::own_package},
    {"app_data_restore_start", {kPkgId, kReqId}, kRet, method_rights::own_package},
    {"make_app_data", {kPkgId}, kRet, method_rights::own_package},
};

/** @return null: the interface has no such method */
[[nodiscard]] const quarn_method *find_quarn_method(const char *name);

/** Whether arguments of @p signature, without parentheses, are those of the method. */
[[nodiscard]] bool has_signature(const quarn_method &method, const char *signature);

/**
 * Read the arguments of a call.
 * @param arguments a tuple, which the texts are borrowed from; may be null
 * @return nothing when there are none, or others than those of a method @p member
 */
[[nodiscard]] std::optional<quarn_arguments> read_quarn_arguments(const std::string &member,
                                                                  GVariant *arguments);

#endif
