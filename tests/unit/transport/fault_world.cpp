#include "fault_world.h"

#include "core/remote_path.h"
#include "session/session.h"
#include "stores/make_backend.h"

using namespace harness;
using front::Spoil;
using transport::Attempt;
using transport::Backend;
using transport::Config;
using transport::Outcome;

namespace {

constexpr char kNeighbour[] = "/f/p";
constexpr std::size_t kObjectBytes = 100000;
constexpr std::chrono::seconds kRetryTotal{BACKUP_TRANS_RETRY_TOTAL_SECONDS};

const std::string &old_content() {
  static const std::string content = bytes(kObjectBytes, 1);
  return content;
}

const std::string &new_content() {
  static const std::string content = bytes(kObjectBytes, 2);
  return content;
}

std::string word_of(int code) {
  switch (code) {
    case BACKUP_TRANS_ERROR_NONE:
      return "success";
    case BACKUP_TRANS_ERROR_AUTHENTICATION:
      return "authentication";
    case BACKUP_TRANS_ERROR_NETWORK:
      return "network";
    case BACKUP_TRANS_ERROR_NO_SUCH_OBJECT:
      return "absent";
    case BACKUP_TRANS_ERROR_QUOTA:
      return "quota";
    case BACKUP_TRANS_ERROR_CONFLICT:
      return "conflict";
    case BACKUP_TRANS_ERROR_CANCELLED:
      return "cancelled";
    case BACKUP_TRANS_ERROR_SERVER:
      return "server";
    case BACKUP_TRANS_ERROR_LOCAL_FILE:
      return "local file";
    case BACKUP_TRANS_ERROR_CERTIFICATE:
      return "certificate";
    default:
      return "code " + std::to_string(code);
  }
}

bool speaks_tls(Place place) { return place == Place::tls || place == Place::tls_unknown; }

}  // namespace

/** Notes the attempts at the real store. */
class FaultWorld::Recorder : public Backend {
 public:
  Recorder(FaultWorld *world, std::shared_ptr<Backend> backend)
      : world_(world), backend_(std::move(backend)) {}

  Outcome download(Attempt &attempt, const std::string &path, transport::LocalTarget &target,
                   transport::Version *version) override {
    return note([&] { return backend_->download(attempt, path, target, version); });
  }
  Outcome upload(Attempt &attempt, const transport::Upload &upload,
                 transport::ObjectInfo *info) override {
    return note([&] { return backend_->upload(attempt, upload, info); });
  }
  Outcome list(Attempt &attempt, const std::string &folder, int start, int count,
               transport::ListPage *page) override {
    return note([&] { return backend_->list(attempt, folder, start, count, page); });
  }
  Outcome remove_folder(Attempt &attempt, const std::string &folder) override {
    return note([&] { return backend_->remove_folder(attempt, folder); });
  }

 private:
  Outcome note(const std::function<Outcome()> &call) {
    Tried tried;
    tried.began = world_->clock_.now();
    tried.outcome = call();
    tried.ended = world_->clock_.now();
    const std::lock_guard<std::mutex> lock(world_->mutex_);
    world_->tried_.push_back(tried);
    return tried.outcome;
  }

  FaultWorld *const world_;
  const std::shared_ptr<Backend> backend_;
};

FaultWorld::FaultWorld(const FaultRow &row, Step step, std::unique_ptr<NetworkStore> store,
                       Time time)
    : row_(row), step_(step), store_(std::move(store)) {
  if (speaks_tls(row.place))
    identity_ =
        std::make_unique<front::Identity>(make_identity(row.certificate_name, row.validity));
  front_ = std::make_unique<front::Front>(store_->service(), identity_.get());
  if (time == Time::passes)
    front_->set_time([this](milliseconds passed) { clock_.pass(passed); });
  else
    clock_.stand();
  transport::set_retry_clock(&clock_, {});
  transport::set_http_clock(time == Time::passes ? &clock_ : &tidying_clock_);
  transport::set_backend_maker([this](const Config &config, std::string *problem) {
    return std::make_shared<Recorder>(this, transport::make_backend(config, problem));
  });
  std::string config = "[cloud]\n" + store_->config(origin());
  if (row.place == Place::tls) {
    write_file(certificates_ / "ca.pem", identity_->certificate);
    config += "ca-file=" + (certificates_ / "ca.pem") + "\n";
  }
  cloud_ = std::make_unique<Cloud>(config);
  store_->put(NetworkStore::kObject, old_content());
  store_->put(kNeighbour, "neighbour");
  local_ = cloud_->file(step == Step::get ? "before" : new_content());
  if (step == Step::lock || step == Step::unlock || step == Step::replace) {
    const std::string seen = cloud_->get(NetworkStore::kObject, BACKUP_TRANS_OPTION_BASIS);
    EXPECT_TRUE(seen == old_content());
  }
  tried_.clear();
  files_before_ = tree(cloud_->dir().path()).size();
}

FaultWorld::~FaultWorld() {
  cloud_.reset();
  EXPECT_TRUE(run_until([] { return threads_named(transport::kWorkerName) == 0; }));
  transport::set_backend_maker(nullptr);
  transport::set_retry_clock(nullptr, {});
  transport::set_http_clock(nullptr);
}

std::string FaultWorld::origin() const {
  // A label of more than 63 letters is no name, which needs no server to tell.
  if (row_.place == Place::unknown_name) return "https://" + std::string(64, 'x') + ".invalid";
  const int port = row_.place == Place::silent_port ? silent_port_.port() : front_->port();
  const bool tls =
      speaks_tls(row_.place) || row_.place == Place::tls_plain || row_.place == Place::tls_silent;
  return std::string(tls ? "https" : "http") + "://127.0.0.1:" + std::to_string(port);
}

void FaultWorld::spoil() {
  if (row_.place == Place::tls_silent) front_->fall_silent();
  if (row_.refused_once) {
    front_->refuse();
    clock_.set_on_pause([this] { front_->accept_again(); });
  }
  front::Rule rule = row_.at_look ? store_->look() : store_->requests_of(step_);
  rule.last = row_.last;
  const Spoil spoilt = row_.fault.spoil;
  const bool is_cut = spoilt == Spoil::reset_request || spoilt == Spoil::stall_request;
  rule.takes_effect = row_.takes_effect || (is_cut && store_->keeps_parts());
  rule.fault = row_.fault;
  if (row_.place == Place::plain && !row_.refused_once) front_->set_rules({rule});
}

AnswerPtr FaultWorld::start() {
  spoil();
  switch (step_) {
    case Step::put:
    case Step::move:
    case Step::lock:
    case Step::unlock:
    case Step::replace:
      answer_ = cloud_->upload(local_, NetworkStore::kObject);
      break;
    case Step::get:
      answer_ = cloud_->download(NetworkStore::kObject, local_);
      break;
    case Step::list:
      answer_ = cloud_->list(NetworkStore::kFolder);
      break;
    case Step::remove:
      answer_ = cloud_->remove(NetworkStore::kFolder);
      break;
  }
  return answer_;
}

bool FaultWorld::wait_held_up() {
  return run_until(
      [this] { return answer_->calls > 0 || clock_.is_standing() || front_->is_stalling(); });
}

bool FaultWorld::finish() {
  return cloud_->settle() && run_until([] { return threads_named(transport::kWorkerName) == 0; });
}

std::vector<Tried> FaultWorld::tried() const {
  const std::lock_guard<std::mutex> lock(mutex_);
  return tried_;
}

std::string FaultWorld::told() const {
  std::string text = answer_->message + "\n";
  for (const Tried &one : tried()) text += one.outcome.message + "\n" + one.outcome.said + "\n";
  return text;
}

std::string FaultWorld::left() const {
  if (step_ == Step::get) {
    const std::string local = read_file(local_);
    return local == "before" ? "kept" : local == old_content() ? "whole" : "DAMAGED";
  }
  const auto content = store_->content();
  const auto object = content.find(NetworkStore::kObject);
  if (step_ == Step::list)
    return answer_->children.size() == 2 ? "whole" : answer_->children.empty() ? "none" : "DAMAGED";
  std::string text = object == content.end()           ? "gone"
                     : object->second == old_content() ? "old"
                     : object->second == new_content() ? "new"
                                                       : "DAMAGED";
  for (const auto &[path, ignored] : content) {
    if (path != NetworkStore::kObject && path != kNeighbour) text += " + part";
  }
  if (store_->leftovers() > 0) text += " + lock";
  return text;
}

std::string FaultWorld::summary() const {
  return word_of(answer_->code) + " " + std::to_string(tried().size()) + " " + left();
}

std::string FaultWorld::objection() const {
  const std::vector<Tried> all = tried();
  if (all.empty()) return "nothing was tried";
  if (all.back().began - all.front().ended >= kRetryTotal) return "it was tried for too long";
  return damage();
}

std::string FaultWorld::damage() const {
  if (tree(cloud_->dir().path()).size() != files_before_) return "files were left on the device";
  if (step_ != Step::remove && store_->content().count(kNeighbour) == 0)
    return "the neighbour is gone";
  const std::string found = left();
  return found.find("DAMAGED") == std::string::npos && found.find("part") == std::string::npos
             ? ""
             : found;
}
