#include "client/UpdateAndReportServices.h"

#include <utility>

namespace telvane {

std::shared_ptr<const UpdateAndReportServices> UpdateAndReportServices::create(bool update, bool report,
                                                                               Telvane::PeriodicServiceBlock block) {
  if (!block) return nullptr;
  return std::shared_ptr<const UpdateAndReportServices>(new UpdateAndReportServices(update, report, std::move(block)));
}

UpdateAndReportServices::UpdateAndReportServices(bool update, bool report, Telvane::PeriodicServiceBlock block)
    : update_(update), report_(report), block_(std::move(block)) {}

}  // namespace telvane
