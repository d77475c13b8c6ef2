// errhub: the host's error record and its reporting.
#pragma once

#include <string>

#include "vexatypes.h"

// The host's error record, thrown as an exception by host code and by
// callbacks: a message a person can act on and a one-byte attribute whose
// meaning belongs to the host. Copying keeps both.
class VEXAHOST_API ErrorText {
 public:
  ErrorText() : attribute(0) {}
  explicit ErrorText(std::string message, unsigned char attr = 0)
      : text(std::move(message)), attribute(attr) {}

  const std::string& Text() const { return text; }
  unsigned char Attribute() const { return attribute; }

  std::string text;
  unsigned char attribute;
};

// Thrown by host code to abandon the current operation and return to the
// host's caller; carries nothing.
class VexaGoToCaller {};

// Reports ErrorText records through a reporting function (Reporter, in
// vexawdat.h, is the host's). The monitor does not own the function.
class VEXAHOST_API VexaErrorMonitor {
 public:
  typedef void (*ReportFunction)(const char* text, int attribute);
  explicit VexaErrorMonitor(ReportFunction reporter);
  ~VexaErrorMonitor();
  VexaErrorMonitor(const VexaErrorMonitor&) = delete;
  VexaErrorMonitor& operator=(const VexaErrorMonitor&) = delete;

  // Hands the error's text and attribute to the reporting function.
  void Report(ErrorText error);

 private:
  ReportFunction reporter_;
};
