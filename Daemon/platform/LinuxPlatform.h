#pragma once
// Installs the Linux implementation of every platform interface into a
// daemon context. The daemon calls it once at start; tests call it on their
// temporary root and may then replace single pieces with fakes.

namespace quarn {

class QRNDaemonContext;

void installLinuxPlatform(QRNDaemonContext& context);

} // namespace quarn
