/* Standard output, written a whole text at a time so that whoever reads it sees lines at once. No
 * lock: one thread writes.
 */
#pragma once

#include <string_view>

namespace cli {

class Output {
 public:
  /* Writes all of it. When the reader has gone, that is noted and this and all that follows is
   * dropped. Throws std::system_error on any other failure. Blocks. */
  void write(std::string_view text);

  /* The reader has gone: nobody wants more. */
  bool readerGone() const { return readerGone_; }

  /* Whether colours are shown: on a terminal whose user did not ask to do without (NO_COLOR). */
  bool colour() const;

 private:
  bool readerGone_ = false;
};

}  // namespace cli
