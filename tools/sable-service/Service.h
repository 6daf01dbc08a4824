#pragma once

#include <string>

#include "Bag.h"
#include "Faults.h"
#include "Index.h"
#include "Message.h"
#include "Recorder.h"
#include "Search.h"
#include "Uploads.h"

namespace httplib {
struct Response;
}

namespace service {

/// A request's way: its faults are chosen, its endpoint answers, the faults change the answer, the record is
/// written, and only then, after any delay, the answer leaves. Safe from any thread.
class Service {
 public:
  /// `base` is the service's own address; the others outlive the service.
  Service(const std::string& base, const Index& index, Faults& faults, Recorder& recorder);

  Bag& bag() { return bag_; }

  /// Answers on the connection that the calling thread serves.
  void handle(const Request& request, httplib::Response& response);

 private:
  Answer route(const Request& request, const FaultPlan& plan);
  Answer get(const Request& request, const FaultPlan& plan);
  Answer post(const Request& request, const FaultPlan& plan);
  /// POST /control: {"fault": RULE or [RULE...], "clear_faults": true, "bag": {...}, "bag_version": V,
  /// "resource": {ID: TEXT}}; any of them, clearing first.
  Answer control(const Request& request);

  Bag bag_;
  const Search search_;
  Faults& faults_;
  Recorder& recorder_;
  Uploads uploads_;
};

}  // namespace service
