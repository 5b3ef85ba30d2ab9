/**
 * @file network_store.h
 * @brief What the fault matrix needs to know of a network store.
 */
#ifndef TRANSPORT_NETWORK_STORE_H
#define TRANSPORT_NETWORK_STORE_H

#include <array>
#include <map>
#include <memory>
#include <string>

#include "http_front.h"

/** Requests that a fault can hit. */
enum class Step {
  put,     /**< an upload's bytes */
  move,    /**< an upload's last step, where the store has one */
  lock,    /**< what the last steps of an upload with a basis begin with, where there are locks */
  unlock,  /**< what they end with */
  get,     /**< a download */
  list,    /**< a listing */
  remove,  /**< a folder's deletion */
  replace, /**< the bytes of an upload with a basis, where they go to the object's place */
};
constexpr std::size_t kSteps = 8;
constexpr std::array<const char *, kSteps> kStepNames = {"put", "move", "lock",   "unlock",
                                                         "get", "list", "remove", "replace"};

/** A model of one server's store. */
class NetworkStore {
 public:
  NetworkStore() = default;
  NetworkStore(const NetworkStore &) = delete;
  NetworkStore &operator=(const NetworkStore &) = delete;
  virtual ~NetworkStore() = default;

  virtual front::Service &service() = 0;
  /** The configuration's lines, for a server at @p origin, "http://HOST:PORT". */
  virtual std::string config(const std::string &origin) const = 0;
  /** Which requests are the step's, with kFolder and kObject; the method is "" when none are. */
  virtual front::Rule requests_of(Step step) const = 0;
  /** How to look at an object that was just uploaded; the method is "" when nobody looks. */
  virtual front::Rule look() const = 0;

  virtual std::map<std::string, std::string> content() const = 0;
  virtual void put(const std::string &path, const std::string &content) = 0;
  /** Does what came of an upload that was cut off stay? */
  virtual bool keeps_parts() const { return false; }
  /** Locks, unfinished uploads and the like. */
  virtual std::size_t leftovers() const = 0;

  /** What must never be seen outside the Authorization header. */
  static constexpr char kSecret[] = "s3cr3t-pAsSwOrD";
  static constexpr char kFolder[] = "/f";
  static constexpr char kObject[] = "/f/o";
};

/** A kind of network store; what the matrix is instantiated with. */
struct NetworkKind {
  const char *name;
  std::unique_ptr<NetworkStore> (*make)();
};

#endif
