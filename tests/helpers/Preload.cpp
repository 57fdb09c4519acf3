// A library that a user preloads into a signed program (LD_PRELOAD) in the
// identity tests: it announces on standard output that its code runs there.
#include <unistd.h>

namespace {

[[gnu::constructor]] void announce() {
    static constexpr char kLine[] = "preloaded\n";
    (void)!::write(STDOUT_FILENO, kLine, sizeof kLine - 1);
}

}  // namespace
