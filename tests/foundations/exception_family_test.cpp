// The exception family: texts, the one static instance per class, and the
// handlers that match.
#include <gtest/gtest.h>

#include <cstring>
#include <functional>
#include <set>
#include <string>

#include "N_Exceptions.h"
#include "Q_Throw.h"

namespace {

// What a handler of type H caught, or null if the exception got past it.
template <class H>
void* caughtAs(const std::function<void()>& thrower) {
  try {
    try {
      thrower();
    } catch (H caught) {
      return const_cast<void*>(static_cast<const void*>(caught));
    }
  } catch (void*) {
  }
  return nullptr;
}

Q_Exception* thrown(const std::function<void()>& thrower) { return static_cast<Q_Exception*>(caughtAs<Q_Exception*>(thrower)); }

}  // namespace

TEST(QException, EachClassThrowsItsTextFromAnInstanceOfItsOwn) {
  const std::pair<std::function<void()>, const char*> throws[] = {
      {Q_Throw<Q_MemoryException_Allocation>, "Out of system memory resources"},
      {Q_Throw<N_NetException_Unavailable>, "WINSOCK: Network subsystem is unavailable"},
      {Q_Throw<N_NetException_NotSupported>, "WINSOCK: DLL version out of range"},
      {Q_Throw<N_NetException_ProcessLimit>, "WINSOCK: Too many processes"},
      {Q_Throw<N_NetException_VersionFailure>, "Winsock version 2.0 or newer required"},
      {Q_Throw<N_NetException_NoTCP>, "TCP protocol not found"},
      {Q_Throw<N_NetException_NoUDP>, "UDP protocol not found"},
      {Q_Throw<N_NetException_IPNotResolved>, "IP address is not resolved yet"},
      {Q_Throw<N_NetException_LocalAddressAlreadyInUse>, "Local address is already bound to other socket"},
      {Q_ThrowPacketsStackingUp, "Packets are stacking up. Already 4.00 seconds of data waiting in queue"},
      {[] { Q_ThrowPacketTooBig(70000, 65536); },
       "Packet 70000 bytes exceeds 65536 byte limit when not using distributed packet mechanism"},
  };
  std::set<Q_Exception*> instances;
  for (const auto& [thrower, text] : throws) {
    Q_Exception* e = thrown(thrower);
    ASSERT_NE(nullptr, e) << text;
    EXPECT_STREQ(text, e->getErrorMessage());
    EXPECT_EQ(e, thrown(thrower)) << "a second throw raises the same instance";
    instances.insert(e);
  }
  EXPECT_EQ(std::size(throws), instances.size());
  EXPECT_EQ(thrown(Q_Throw<Q_MemoryException_Allocation>), thrown(Q_ThrowAllocation));
  Q_Exception* tooBig = thrown([] { Q_ThrowPacketTooBig(99, 42); });
  EXPECT_STREQ("Packet 99 bytes exceeds 42 byte limit when not using distributed packet mechanism",
               tooBig->getErrorMessage()) << "the latest text, in the one instance";
}

TEST(QException, HandlersOfEveryBaseMatchAndTheTwoBranchesDoNotCross) {
  const std::function<void()> noTcp = Q_Throw<N_NetException_NoTCP>;
  void* instance = caughtAs<N_NetException_NoTCP*>(noTcp);
  ASSERT_NE(nullptr, instance);
  EXPECT_EQ(instance, caughtAs<N_NetException*>(noTcp));
  EXPECT_EQ(instance, caughtAs<const Q_Exception*>(noTcp));
  EXPECT_EQ(instance, caughtAs<CException*>(noTcp));
  EXPECT_EQ(instance, caughtAs<CObject*>(noTcp));
  EXPECT_EQ(instance, caughtAs<void*>(noTcp));
  EXPECT_EQ(nullptr, caughtAs<N_NetException*>(Q_ThrowAllocation));
  EXPECT_NE(nullptr, caughtAs<Q_MemoryException*>(Q_ThrowAllocation));
  EXPECT_EQ(nullptr, caughtAs<Q_MemoryException*>(Q_ThrowPacketsStackingUp));
  EXPECT_EQ(nullptr, caughtAs<N_NetException_NoTCP*>(Q_Throw<N_NetException_NoUDP>));
  CRuntimeClass* runtimeClass = static_cast<CObject*>(instance)->GetRuntimeClass();
  EXPECT_STREQ("Q_Exception", runtimeClass->m_lpszClassName);
  EXPECT_EQ(runtimeClass, thrown(Q_ThrowAllocation)->GetRuntimeClass());
}

TEST(QException, TextsAreCutCopiedAndReported) {
  N_NetException_PacketTooBig a, b;
  EXPECT_STREQ("", a.getErrorMessage());
  a.setError("%s", std::string(2000, 'x').c_str());
  EXPECT_EQ(std::string(Q_Exception::kMaxErrorLength, 'x'), a.getErrorMessage());
  b.setError("size %d", 12);
  a = b;
  EXPECT_STREQ("size 12", a.getErrorMessage());
  b.setError(nullptr);
  EXPECT_STREQ("", b.getErrorMessage());
  char buffer[8] = "#######";
  unsigned help = 77;
  EXPECT_TRUE(N_NetException_NoTCP().GetErrorMessage(buffer, 4, &help));
  EXPECT_STREQ("TCP", buffer);
  EXPECT_EQ('#', buffer[4]) << "wrote past the size it was given";
  EXPECT_EQ(0u, help);
  EXPECT_FALSE(N_NetException().GetErrorMessage(buffer, sizeof buffer)) << "no text, no message";
  EXPECT_FALSE(N_NetException_NoTCP().GetErrorMessage(nullptr, 8));
  EXPECT_FALSE(CException().GetErrorMessage(buffer, sizeof buffer));
  EXPECT_STREQ("", buffer);
  testing::internal::CaptureStderr();
  EXPECT_EQ(1, static_cast<CException&>(a).ReportError());
  EXPECT_EQ(1, N_NetException().ReportError());
  EXPECT_EQ(1, CException().ReportError());
  EXPECT_EQ("size 12\nNo error message is available.\nNo error message is available.\n",
            testing::internal::GetCapturedStderr());
}
