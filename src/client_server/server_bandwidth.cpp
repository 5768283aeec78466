// N_Server's division of its bandwidth budget among the clients.
//
// The arithmetic is fixed to the bit, since clients of other builds must
// arrive at the same grants: 32-bit unsigned sums that wrap; the sum and the
// excess converted to true 32-bit floats (round to nearest, ties to even);
// quotient and product in double; the product narrowed to float; that cut
// rounded to a whole number, ties to even.
#include <cfloat>
#include <cmath>

#include "ControlMessage.h"
#include "N_Server.h"
#include "Q_Mutex.h"

// The float steps must really be 32-bit, not held wider.
static_assert(FLT_EVAL_METHOD == 0, "float arithmetic must not be evaluated in a wider type");

unsigned N_Server::shareOf(unsigned requested, unsigned maximum) { return requested < maximum ? requested : maximum; }

N_Server::BandwidthDivision N_Server::divide(unsigned budget, unsigned total) {
  BandwidthDivision division;
  // Read as signed: the budget and the total are meant to stay below 2^31.
  const unsigned difference = budget - total;
  division.uExcess = (difference & 0x80000000u) != 0 ? total - budget : 0;
  division.fTotal = static_cast<float>(total);
  division.fExcess = static_cast<float>(division.uExcess);
  return division;
}

unsigned N_Server::grantOf(const BandwidthDivision& division, unsigned share) {
  if (division.uExcess == 0) return share;
  const double quotient = static_cast<double>(share) / static_cast<double>(division.fTotal);
  const double product = static_cast<double>(division.fExcess) * quotient;
  const float cut = static_cast<float>(product);
  // Nearest whole number, ties to even, whatever the rounding mode is.
  double whole = std::floor(static_cast<double>(cut));
  const double fraction = static_cast<double>(cut) - whole;
  if (fraction > 0.5 || (fraction == 0.5 && std::fmod(whole, 2.0) != 0.0)) whole += 1.0;
  // Above 2^24 the float can round the cut past the share; the grant would
  // then wrap around to nearly 2^32, so it is held at 0. A cut that isn't a
  // number (a total that wrapped to 0) is held the same way.
  if (!(whole >= 0.0) || whole > static_cast<double>(share)) return 0;
  return share - static_cast<unsigned>(whole);
}

void N_Server::solveBandwidth(bool changedOnly) {
  if (!m_bServerConstructed) return;
  Q_MutexLock lock(m_pMutex);
  const unsigned maximum = m_uMaximumBandwidthUsage;
  const unsigned budget = m_uBandwidth;
  // Every client counts, paired or not, connected or not.
  unsigned total = 0;
  for (N_Client** entry = m_pClients->getFirst(); entry != nullptr; entry = m_pClients->getNext(entry))
    total += shareOf((*entry)->getRequestedBandwidth(), maximum);
  if (m_pClients->getFirst() == nullptr) return;
  const BandwidthDivision division = divide(budget, total);
  for (N_Client** entry = m_pClients->getFirst(); entry != nullptr; entry = m_pClients->getNext(entry)) {
    N_Client* client = *entry;
    client->grantBandwidth(grantOf(division, shareOf(client->getRequestedBandwidth(), maximum)), changedOnly);
  }
}
