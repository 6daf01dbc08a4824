#pragma once

namespace sable {

/// Who uploads stored sessions in the background, as seen by those who steer it. Any thread.
class BackgroundFlusher {
 public:
  virtual ~BackgroundFlusher() = default;

  /// Whether runs of the background activity do nothing from here on; the files stay where they are.
  virtual bool stopFlushing() const = 0;
  virtual void setStopFlushing(bool stop) = 0;
  /// Uploads all complete sessions, later, whether stopped or not. Nothing is made of `flag`, which is
  /// 0 everywhere.
  virtual void insertFlushActivity(int flag) = 0;
};

}  // namespace sable
