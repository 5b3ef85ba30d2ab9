/**
 * @file disk_store.h
 * @brief A folder store on the disk that is there.
 */
#ifndef TRANSPORT_DISK_STORE_H
#define TRANSPORT_DISK_STORE_H

#include "conformance.h"

class DiskStore : public TestStore {
 public:
  DiskStore();
  ~DiskStore() override;
  std::string config() const override { return config_for("store here"); }
  std::string other_config() override { return config_for("other"); }
  std::map<std::string, std::string> content() const override;
  void put(const std::string &path, const std::string &content) override;
  void hold() override;
  void release() override;
  void fill(std::size_t bytes) override;
  void unfill() override;
  void lock_out() override;
  void let_in() override;
  bool lists_timestamps() const override { return true; }

  std::string root() const { return dir_ / "store here"; }
  const harness::TempDir &dir() const { return dir_; }

 private:
  std::string config_for(const std::string &name) const;

  harness::TempDir dir_;
  int held_ = -1;
};

#endif
