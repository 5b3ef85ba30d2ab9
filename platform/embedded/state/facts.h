/**
 * @file facts.h
 * @brief What an embedded device is and finds around it: device.ini.
 *
 * Facts are texts. Each change of one is counted, so that a change that was
 * taken back at once is still seen as one. Any thread.
 */
#ifndef QUARN_EMBEDDED_FACTS_H
#define QUARN_EMBEDDED_FACTS_H

#include <cstdint>
#include <string>

namespace embedded {

inline constexpr char kFactsFile[] = "device.ini";

inline constexpr char kModel[] = "model";
inline constexpr char kSerial[] = "serial";
inline constexpr char kAccount[] = "account"; /**< user name, empty without an account */
inline constexpr char kModem[] = "modem";     /**< on, off */
inline constexpr char kNetwork[] = "network"; /**< wifi, cellular, none */
inline constexpr char kCharger[] = "charger"; /**< on, off */
inline constexpr char kDisplay[] = "display"; /**< on, dim, off */

struct Fact {
  std::string value;
  std::int64_t changes = 0; /**< how often it changed since the device was made */
};

/** Read a fact; false when the file cannot be read. */
bool get_fact(const std::string &device, const char *key, Fact *fact);

/** Change a fact; setting what is set already is no change. */
bool set_fact(const std::string &device, const char *key, const std::string &value);

}  // namespace embedded

#endif
