#include "network_kinds.h"
#include "s3_model.h"

namespace {

class S3NetworkStore : public NetworkStore {
 public:
  S3NetworkStore() { model_.set_secret(kSecret); }
  front::Service &service() override { return model_; }
  std::string config(const std::string &origin) const override {
    return "url=s3+" + origin + "/" + S3Model::kBucket + "\nuser=" + S3Model::kUser +
           "\npassword=" + kSecret + "\n";
  }
  front::Rule requests_of(Step step) const override {
    switch (step) {
      case Step::put:
        return {"PUT", "/f/o"};
      case Step::get:
        return {"GET", "/f/o"};
      case Step::list:
        return {"GET", "list-type=2"};
      case Step::remove:
        return {"POST", "delete"};
      case Step::move:
      case Step::lock:
      case Step::unlock:
      case Step::replace:
        break;
    }
    return {};
  }
  front::Rule look() const override { return {"HEAD", "/f/o"}; }
  std::map<std::string, std::string> content() const override {
    std::map<std::string, std::string> found;
    for (const auto &[key, content] : model_.content()) found["/" + key] = content;
    return found;
  }
  void put(const std::string &path, const std::string &content) override {
    model_.put(path.substr(1), content);
  }
  std::size_t leftovers() const override { return 0; }

 private:
  S3Model model_;
};

}  // namespace

std::unique_ptr<NetworkStore> make_s3_network_store() { return std::make_unique<S3NetworkStore>(); }
