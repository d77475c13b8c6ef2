// errhub's monitor and VEXAWDAT's Reporter: both end at the host's sink.
#include "hostinternal.h"
#include "isort/host/errhub.h"
#include "isort/host/vexawdat.h"

VexaErrorMonitor::VexaErrorMonitor(ReportFunction reporter) : reporter_(reporter) {}

VexaErrorMonitor::~VexaErrorMonitor() {}

void VexaErrorMonitor::Report(ErrorText error) {
  ReportFunction report = reporter_ ? reporter_ : &Reporter;
  report(error.text.c_str(), error.attribute);
}

// The attribute's meaning belongs to the host's message system; the sink
// takes the text alone.
void Reporter(const char* text, int /*attribute*/) {
  vexahost::internal::Report(text ? text : "");
}
