#include "platform_connection.h"

#include <memory>
#include <string>

#include "state/fact_watch.h"

struct connection_s {
  std::unique_ptr<embedded::FactWatch> watch;
};

namespace {

connection_type_e type_of(const std::string &network) {
  if (network == "wifi") return CONNECTION_TYPE_WIFI;
  if (network == "cellular") return CONNECTION_TYPE_CELLULAR;
  return CONNECTION_TYPE_DISCONNECTED;
}

}  // namespace

int connection_create(connection_h *connection) {
  if (connection == nullptr) return CONNECTION_ERROR_INVALID_PARAMETER;
  if (embedded::current_device().empty()) return CONNECTION_ERROR_OPERATION_FAILED;
  *connection = new connection_s;
  return CONNECTION_ERROR_NONE;
}

int connection_destroy(connection_h connection) {
  if (connection == nullptr) return CONNECTION_ERROR_INVALID_PARAMETER;
  delete connection;
  return CONNECTION_ERROR_NONE;
}

int connection_get_type(connection_h connection, connection_type_e *type) {
  if (connection == nullptr || type == nullptr) return CONNECTION_ERROR_INVALID_PARAMETER;
  embedded::Fact fact;
  if (!embedded::get_fact(embedded::current_device(), embedded::kNetwork, &fact)) {
    return CONNECTION_ERROR_OPERATION_FAILED;
  }
  *type = type_of(fact.value);
  return CONNECTION_ERROR_NONE;
}

int connection_set_type_changed_cb(connection_h connection, connection_type_changed_cb callback,
                                   void *user_data) {
  if (connection == nullptr || callback == nullptr) return CONNECTION_ERROR_INVALID_PARAMETER;
  connection->watch = std::make_unique<embedded::FactWatch>(
      embedded::kNetwork,
      [callback, user_data](const std::string &network) { callback(type_of(network), user_data); });
  if (*connection->watch) return CONNECTION_ERROR_NONE;
  connection->watch.reset();
  return CONNECTION_ERROR_OPERATION_FAILED;
}

int connection_unset_type_changed_cb(connection_h connection) {
  if (connection == nullptr || !connection->watch) return CONNECTION_ERROR_INVALID_PARAMETER;
  connection->watch.reset();
  return CONNECTION_ERROR_NONE;
}
