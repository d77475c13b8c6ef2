#include "Stats.h"

#include <algorithm>

namespace isortcli {
namespace {

std::string Seconds(double s) {
  char text[32];
  std::snprintf(text, sizeof text, "%.2f s", s);
  return text;
}

std::string Ms(std::uint64_t ms) { return Seconds(static_cast<double>(ms) / 1000.0); }

void Row(std::FILE* out, const char* label, const std::string& value) {
  std::fprintf(out, "  %-18s %s\n", label, value.c_str());
}

}  // namespace

std::string ShortBytes(double bytes) {
  char text[32];
  if (bytes >= 1e9) {
    std::snprintf(text, sizeof text, "%.2f GB", bytes / 1e9);
  } else if (bytes >= 1e6) {
    std::snprintf(text, sizeof text, "%.1f MB", bytes / 1e6);
  } else if (bytes >= 1e3) {
    std::snprintf(text, sizeof text, "%.1f kB", bytes / 1e3);
  } else {
    std::snprintf(text, sizeof text, "%.0f B", bytes);
  }
  return text;
}

std::string Grouped(std::uint64_t n) {
  std::string digits = std::to_string(n);
  std::string out;
  for (std::size_t i = 0; i < digits.size(); ++i) {
    if (i != 0 && (digits.size() - i) % 3 == 0) out.push_back(',');
    out.push_back(digits[i]);
  }
  return out;
}

void PrintStatistics(std::FILE* out, const FileSort::Statistics& s, const SortReport& r) {
  std::fprintf(out, "isort statistics\n");
  Row(out, "input", r.input + ", " + ShortBytes(static_cast<double>(r.inputBytes)));
  std::string record = Grouped(s.records) + " of " + std::to_string(r.nvars * 8u) + " bytes (" +
                       std::to_string(r.nvars) + " values: " + std::to_string(r.keyValues) + " key";
  if (!r.binary) {
    record += ", 1 row place, " + std::to_string(r.rowCapacity / 8) + " row bytes";
  } else {
    record += ", " + std::to_string(r.nvars - r.keyValues) + " other";
  }
  record += ")";
  Row(out, "records", record);
  char mib[48];
  std::snprintf(mib, sizeof mib, "%.1f MiB", static_cast<double>(r.memoryTarget) / 1048576.0);
  Row(out, "memory target", mib);
  Row(out, "threads", std::to_string(s.threads));

  if (s.runs.empty()) {
    Row(out, "runs", "none");
  } else {
    std::uint64_t minRecords = UINT64_MAX, maxRecords = 0, total = 0;
    std::uint64_t read = 0, sort = 0, write = 0;
    std::uint32_t share = 0, capacity = 0;
    for (const FileSort::Statistics::RunInfo& run : s.runs) {
      minRecords = std::min<std::uint64_t>(minRecords, run.records);
      maxRecords = std::max<std::uint64_t>(maxRecords, run.records);
      total += run.records;
      read += run.readTime2;
      sort += run.sortTime2;
      write += run.writeTime2;
      share = std::max(share, run.memoryShare);
      capacity = std::max(capacity, run.capacity);
    }
    std::snprintf(mib, sizeof mib, "%.1f MiB", static_cast<double>(share) / 1048576.0);
    std::string runs = std::to_string(s.runs.size()) + " of " + Grouped(minRecords);
    if (maxRecords != minRecords) runs += " to " + Grouped(maxRecords);
    runs += " records (mean " + Grouped(total / s.runs.size()) + "; room for " + Grouped(capacity) +
            " in a worker's share of " + mib + ")";
    Row(out, "runs", runs);
    Row(out, "run times (sum)", "read " + Ms(read) + ", sort " + Ms(sort) + ", write " + Ms(write) +
                                    (s.runs.size() == 1 && s.workFileBytes == 0 ? " (delivered from memory)" : ""));
  }
  if (s.merges.empty()) {
    Row(out, "merge passes", "0");
  } else {
    std::uint64_t intermediate = 0, time2 = 0, time1 = 0;
    for (const FileSort::Statistics::MergeInfo& m : s.merges) {
      intermediate += m.bytes;
      time2 += m.time2;
      time1 += m.time1;
    }
    std::string merges = std::to_string(s.merges.size()) + " (";
    for (std::size_t i = 0; i < s.merges.size(); ++i) {
      if (i != 0) merges += ", ";
      if (i == 4 && s.merges.size() > 6) {
        merges += "...";
        i = s.merges.size() - 2;
        continue;
      }
      merges += std::to_string(s.merges[i].runs);
    }
    merges += " runs), " + Ms(time2) + " (CPU " + Ms(time1) + ")";
    Row(out, "merge passes", merges);
    Row(out, "temporary bytes", ShortBytes(static_cast<double>(s.workFileBytes)) + " runs, " +
                                    ShortBytes(static_cast<double>(intermediate)) + " intermediate merges");
  }
  if (s.merges.empty()) Row(out, "temporary bytes", ShortBytes(static_cast<double>(s.workFileBytes)));
  if (!r.binary) {
    Row(out, "long rows", Grouped(r.sideRows) + " over " + std::to_string(r.rowCapacity) + " bytes kept aside (" +
                              ShortBytes(static_cast<double>(r.sideBytes)) + ")");
    if (r.unparsable != 0) Row(out, "not numbers", Grouped(r.unparsable) + " numeric key fields, sorted as missing");
  }
  std::string phases;
  if (r.firstPassSeconds >= 0) phases += "first pass " + Seconds(r.firstPassSeconds) + "; ";
  phases += "input phase " + Ms(s.runPhaseTime2) + " (CPU " + Ms(s.runPhaseTime1) + "); ";
  const double merge = r.sortSeconds - static_cast<double>(s.runPhaseTime2) / 1000.0;
  phases += "merge and output " + Seconds(merge > 0 ? merge : 0) + "; total " + Seconds(r.totalSeconds);
  Row(out, "phase times", phases);
}

}  // namespace isortcli
