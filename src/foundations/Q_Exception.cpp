#include "Q_Exception.h"

#include <cstdarg>
#include <cstdio>
#include <cstring>

namespace {
const char kNoMessage[] = "No error message is available.";
}  // namespace

CRuntimeClass CObject::classCObject = {"CObject", static_cast<int>(sizeof(CObject)), nullptr};
CRuntimeClass CException::classCException = {"CException", static_cast<int>(sizeof(CException)),
                                             &CObject::classCObject};
CRuntimeClass Q_Exception::classQ_Exception = {"Q_Exception", static_cast<int>(sizeof(Q_Exception)),
                                               &CException::classCException};

CObject::CObject() = default;
CObject::~CObject() = default;

CRuntimeClass* CObject::GetRuntimeClass() const { return &classCObject; }
void CObject::Serialize(CArchive&) {}
void CObject::AssertValid() const {}
void CObject::Dump(CDumpContext&) const {}

CException::CException() = default;
CException::~CException() = default;

CRuntimeClass* CException::GetRuntimeClass() const { return &classCException; }

platform::BOOL CException::GetErrorMessage(char* lpszError, unsigned nMaxError, unsigned* pnHelpContext) {
  if (pnHelpContext != nullptr) *pnHelpContext = 0;
  if (lpszError != nullptr && nMaxError > 0) lpszError[0] = '\0';
  return platform::FALSE;
}

int CException::ReportError(unsigned, unsigned) {
  char text[Q_Exception::kMaxErrorLength + 1];
  if (!GetErrorMessage(text, sizeof text)) std::snprintf(text, sizeof text, "%s", kNoMessage);
  std::fprintf(stderr, "%s\n", text);
  return 1;
}

Q_Exception::Q_Exception() { m_szError[0] = '\0'; }

Q_Exception::~Q_Exception() = default;

CRuntimeClass* Q_Exception::GetRuntimeClass() const { return &classQ_Exception; }

platform::BOOL Q_Exception::GetErrorMessage(char* lpszError, unsigned nMaxError, unsigned* pnHelpContext) {
  if (pnHelpContext != nullptr) *pnHelpContext = 0;
  if (lpszError == nullptr || nMaxError == 0) return platform::FALSE;
  std::snprintf(lpszError, nMaxError, "%s", m_szError);
  return m_szError[0] != '\0' ? platform::TRUE : platform::FALSE;
}

int Q_Exception::ReportError(unsigned, unsigned) {
  std::fprintf(stderr, "%s\n", m_szError[0] != '\0' ? m_szError : kNoMessage);
  return 1;
}

const char* Q_Exception::getErrorMessage() const { return m_szError; }

Q_Exception& Q_Exception::operator=(const Q_Exception& other) {
  if (this != &other) std::memcpy(m_szError, other.m_szError, sizeof m_szError);
  return *this;
}

void Q_Exception::setError(const char* format, ...) {
  if (format == nullptr) {
    m_szError[0] = '\0';
    return;
  }
  std::va_list args;
  va_start(args, format);
  std::vsnprintf(m_szError, sizeof m_szError, format, args);
  va_end(args);
}
