// Root of the library's exception family, and the small part of MFC's object
// model it sits on (CObject, CException, CRuntimeClass). Only what the family
// uses is here: a runtime class record, the virtual operations in MFC's order,
// and the two error-text operations of CException.
//
// Exceptions are thrown as pointers to long-lived static instances and caught
// by pointer; a handler never deletes what it caught (see N_Exceptions.h).
#pragma once

#include "vardel_export.h"
#include "vardel_platform.h"

class CArchive;      // never defined: serialisation is not supported
class CDumpContext;  // never defined: diagnostic dumps are not supported

// What GetRuntimeClass answers: the class's name, its size and its base.
struct VARDEL_API CRuntimeClass {
  const char* m_lpszClassName;
  int m_nObjectSize;
  CRuntimeClass* m_pBaseClass;
};

class VARDEL_API CObject {
 public:
  virtual CRuntimeClass* GetRuntimeClass() const;
  virtual ~CObject();
  // The three below do nothing; they keep MFC's virtual layout.
  virtual void Serialize(CArchive& ar);
  virtual void AssertValid() const;
  virtual void Dump(CDumpContext& dc) const;

  static CRuntimeClass classCObject;

  // Objects are not copied, as in MFC; classes that carry state assign it.
  CObject(const CObject&) = delete;
  CObject& operator=(const CObject&) = delete;

 protected:
  CObject();
};

class VARDEL_API CException : public CObject {
 public:
  CException();
  ~CException() override;
  CRuntimeClass* GetRuntimeClass() const override;

  // Copies the error text into `lpszError` (at most `nMaxError` - 1 chars and
  // a terminator) and gives TRUE if there was a text. `pnHelpContext`, when
  // given, receives 0: there is no help file.
  virtual platform::BOOL GetErrorMessage(char* lpszError, unsigned nMaxError, unsigned* pnHelpContext = nullptr);
  // There is no message box on this platform: the text goes to stderr as one
  // line. Gives 1, the answer of the box's only button.
  virtual int ReportError(unsigned nType = 0, unsigned nMessageID = 0);

  static CRuntimeClass classCException;
};

class VARDEL_API Q_Exception : public CException {
 public:
  // Every class of the family answers with Q_Exception's runtime class.
  CRuntimeClass* GetRuntimeClass() const override;
  ~Q_Exception() override;
  platform::BOOL GetErrorMessage(char* lpszError, unsigned nMaxError, unsigned* pnHelpContext = nullptr) override;
  int ReportError(unsigned nType = 0, unsigned nMessageID = 0) override;
  virtual const char* getErrorMessage() const;

  // Carries the error text over; that is all the state an exception has.
  Q_Exception& operator=(const Q_Exception& other);

  // Printf-style text, cut to fit kMaxErrorLength. The text lives inside the
  // object, so setting it never allocates, even when memory has run out.
  void setError(const char* format, ...) __attribute__((format(printf, 2, 3)));

  static constexpr unsigned kMaxErrorLength = 511;
  static CRuntimeClass classQ_Exception;

 protected:
  Q_Exception();

 private:
  char m_szError[kMaxErrorLength + 1];
};
