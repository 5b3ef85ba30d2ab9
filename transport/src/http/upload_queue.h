/**
 * @file upload_queue.h
 * @brief What the kernel still holds of an upload, as a sign that the network is only slow.
 */
#ifndef BACKUP_TRANSPORT_UPLOAD_QUEUE_H
#define BACKUP_TRANSPORT_UPLOAD_QUEUE_H

#include <algorithm>
#include <optional>

namespace transport {

/**
 * An exchange's share of its connection's send queue. The connection may be
 * another exchange's too, so a queue that grows says nothing, and one that
 * becomes less only says something while bytes of this exchange can be in it:
 * until as many have left it as were there when the exchange last moved. One
 * thread at a time.
 */
class UploadQueue {
 public:
  /** The exchange itself moved: what is queued from now on may be its own. */
  void restart() { held_.reset(); }

  /** Was the queue looked at since then? */
  bool is_known() const { return held_.has_value(); }

  /** Has everything been taken, as far as is known? */
  bool is_empty() const { return held_.value_or(1) == 0; }

  /**
   * @param held bytes in the queue now
   * @return how many the network took since the last look that may be this exchange's
   */
  int look(int held) {
    if (!held_) own_ = held;
    const int taken = std::max(held_.value_or(held) - held, 0);
    const int moved = std::min(taken, own_);
    own_ = std::min(std::max(own_ - taken, 0), held);
    held_ = held;
    return moved;
  }

 private:
  std::optional<int> held_;  // at the last look
  int own_ = 0;              // how many of them can at most be this exchange's
};

}  // namespace transport

#endif
