// Writing delimited text: whole input rows in a new order, and new rows
// field by field (for generated tables).
#pragma once

#include <cstddef>
#include <string>

#include "OutputFile.h"

namespace isortcli {

// Writes input rows, each as it stood, in the order given, so that the
// output is the input's rows reordered and its line ends are the input's.
//
// A row keeps its own terminator ("\n" or "\r\n"). Only the input's last row
// can lack one; when it comes out anywhere but last it gets the input's
// predominant terminator. Whether the output ends with a terminator follows
// the input: if the input's last row had none, the output's last row loses
// its terminator. So an input that ends without a line end gives an output
// that ends without one, and the byte count only changes when the moved
// row's new terminator differs from the one the last row dropped.
class RowWriter {
 public:
  // `crlf`: the input's predominant terminator is "\r\n".
  RowWriter(OutputFile& out, bool crlf) : out_(out), crlf_(crlf) {}

  void WriteRow(const char* data, std::size_t size) {
    if (pending_ != 0) out_.Write("\r\n" + (2 - pending_), pending_);
    unsigned terminator = 0;
    if (size > 0 && data[size - 1] == '\n') terminator = (size > 1 && data[size - 2] == '\r') ? 2 : 1;
    out_.Write(data, size - terminator);
    pending_ = terminator != 0 ? terminator : (crlf_ ? 2u : 1u);
  }
  // Ends the output: the last row's terminator is written when the input
  // ended with one.
  void Finish(bool inputEndsWithTerminator) {
    if (pending_ != 0 && inputEndsWithTerminator) out_.Write("\r\n" + (2 - pending_), pending_);
    pending_ = 0;
  }

 private:
  OutputFile& out_;
  bool crlf_;
  unsigned pending_ = 0;  // terminator bytes owed to the previous row
};

// Writes one field, quoted when it holds the delimiter, a quote, a carriage
// return or a line feed (quotes doubled).
void AppendField(std::string& line, const char* data, std::size_t size, char delimiter);

}  // namespace isortcli
