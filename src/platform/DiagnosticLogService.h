// DiagnosticLogService: where finished diagnostic logs go to be picked up.
//
// A log is created as a submittable file of a given log type and, once finished,
// handed over ("submitted"). On Linux creation is a plain new file, and submission is
// a move into the submission folder ($TELVANED_SUBMISSION_DIR); without that folder
// submission fails, so that callers delete what they cannot hand over. The log type
// is carried for the interface's sake; the Linux service files every type alike.
//
// Threading: implementations are thread-safe.
#pragma once

#include <memory>
#include <optional>
#include <string>

namespace telvane {

class DiagnosticLogService {
 public:
  virtual ~DiagnosticLogService() = default;

  // Creates a new log file at `path` and returns a descriptor open for writing, which
  // the caller closes; -1 on failure.
  virtual int createLogFile(const std::string& path, const std::string& logType) = 0;
  // Moves the finished file into the submission queue; false when it was not taken.
  virtual bool submitLogFile(const std::string& path, const std::string& logType) = 0;

  // The process's service; the submission folder is $TELVANED_SUBMISSION_DIR as set at
  // first use.
  static std::shared_ptr<DiagnosticLogService> system();
};

// The Linux service submitting into `submissionDir` (created when needed), or
// refusing every submission when there is none.
std::shared_ptr<DiagnosticLogService> makeDiagnosticLogService(std::optional<std::string> submissionDir);

// Moves a file by copying it to `to` and unlinking `from` (used when a rename would
// cross file systems). The copy is written next to `to` and renamed into place, so a
// reader never sees half a file. False, with `from` intact, on failure.
bool copyThenUnlink(const std::string& from, const std::string& to);

}  // namespace telvane
