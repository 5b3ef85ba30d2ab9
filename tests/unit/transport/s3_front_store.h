/**
 * @file s3_front_store.h
 * @brief The S3 store on a service in this process.
 */
#ifndef TRANSPORT_S3_FRONT_STORE_H
#define TRANSPORT_S3_FRONT_STORE_H

#include "conformance.h"
#include "http_front.h"
#include "s3_model.h"

class S3FrontStore : public TestStore {
 public:
  /** What the service has is settled before its first thread starts. */
  explicit S3FrontStore(const S3Model::Settings &settings = S3Model::Settings())
      : model_(settings) {}

  std::string config() const override { return config_for("my%20store"); }
  std::string other_config() override { return config_for("other"); }
  std::map<std::string, std::string> content() const override { return model_.content(kPrefix); }
  void put(const std::string &path, const std::string &content) override {
    model_.put(kPrefix + path, content);
  }
  void hold() override { front_.hold(); }
  void release() override { front_.release(); }
  void fill(std::size_t bytes) override { model_.set_room(bytes); }
  void unfill() override { model_.set_room(static_cast<std::size_t>(-1)); }
  void lock_out() override { model_.set_secret("changed"); }
  void let_in() override { model_.set_secret("secret"); }
  bool lists_timestamps() const override { return false; }

 private:
  static constexpr char kPrefix[] = "my store";

  std::string config_for(const std::string &prefix) const {
    return "[cloud]\nurl=s3+http://127.0.0.1:" + std::to_string(front_.port()) + "/" +
           S3Model::kBucket + "/" + prefix + "\nuser=" + S3Model::kUser + "\npassword=secret\n";
  }

  S3Model model_;
  front::Front front_{model_};
};

#endif
