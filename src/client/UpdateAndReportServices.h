// UpdateAndReportServices: one module registered for the periodic metrics tasks of a
// Telvane object: whether it takes part in update ticks and in report ticks, and its
// service block, which fills the dictionary it is given (on report ticks the filled
// dictionary is the module's contribution to the realtime event).
//
// Immutable after creation; shared by the registry and the module tasks of the ticks
// that run it, so it is safe to use from any thread.
#pragma once

#include <memory>

#include "telvane/Telvane.h"

namespace telvane {

class UpdateAndReportServices {
 public:
  // Null without a block.
  static std::shared_ptr<const UpdateAndReportServices> create(bool update, bool report,
                                                               Telvane::PeriodicServiceBlock block);

  UpdateAndReportServices(const UpdateAndReportServices&) = delete;
  UpdateAndReportServices& operator=(const UpdateAndReportServices&) = delete;

  bool update() const { return update_; }
  bool report() const { return report_; }
  const Telvane::PeriodicServiceBlock& block() const { return block_; }

 private:
  UpdateAndReportServices(bool update, bool report, Telvane::PeriodicServiceBlock block);

  const bool update_;
  const bool report_;
  const Telvane::PeriodicServiceBlock block_;
};

}  // namespace telvane
