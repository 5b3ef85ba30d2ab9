#include "dav_model.h"
#include "network_kinds.h"

namespace {

class DavNetworkStore : public NetworkStore {
 public:
  DavNetworkStore() { model_.set_password(kSecret); }

  front::Service &service() override { return model_; }
  std::string config(const std::string &origin) const override {
    return "url=webdav+" + origin + DavModel::kRoot + "\nuser=" + DavModel::kUser +
           "\npassword=" + kSecret + "\n";
  }
  front::Rule requests_of(Step step) const override {
    switch (step) {
      case Step::put:
        return {"PUT", "/f/"};
      case Step::move:
        // The one that is meant to replace what is there.
        return {"MOVE", "/f/", "overwrite", "T"};
      case Step::lock:
        return {"LOCK", "/f/"};
      case Step::unlock:
        return {"UNLOCK", "/f/"};
      case Step::get:
        return {"GET", "/f/o"};
      case Step::list:
        return {"PROPFIND", "/f/"};
      case Step::remove:
        return {"DELETE", "/f/"};
      case Step::replace:
        break;
    }
    return {};
  }
  front::Rule look() const override { return {"HEAD", "/f/"}; }
  std::map<std::string, std::string> content() const override { return model_.content(); }
  void put(const std::string &path, const std::string &content) override {
    model_.put(path, content);
  }
  std::size_t leftovers() const override { return model_.locks(); }

 protected:
  DavModel model_;
};

class DavInPlaceNetworkStore : public DavNetworkStore {
 public:
  DavInPlaceNetworkStore() { model_.refuse("MOVE", 501); }

  front::Rule requests_of(Step step) const override {
    if (step == Step::put || step == Step::replace) return {"PUT", kObject};
    return {};
  }
  front::Rule look() const override { return {"HEAD", kObject}; }
  bool keeps_parts() const override { return true; }
};

}  // namespace

std::unique_ptr<NetworkStore> make_dav_network_store() {
  return std::make_unique<DavNetworkStore>();
}

std::unique_ptr<NetworkStore> make_dav_in_place_store() {
  return std::make_unique<DavInPlaceNetworkStore>();
}
