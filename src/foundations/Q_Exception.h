/// @file
/// Root of the library's exception family, and the small part of MFC's object
/// model it sits on (CObject, CException, CRuntimeClass). Only what the family
/// uses is here: a runtime class record, the virtual operations in MFC's order,
/// and the two error-text operations of CException.
///
/// Exceptions are thrown as pointers to long-lived static instances and caught
/// by pointer; a handler never deletes what it caught (see N_Exceptions.h).
#pragma once

#include "vardel_export.h"
#include "vardel_platform.h"

class CArchive;      // never defined: serialisation is not supported
class CDumpContext;  // never defined: diagnostic dumps are not supported

/// What GetRuntimeClass answers: the class's name, its size and its base.
struct VARDEL_API CRuntimeClass {
  const char* m_lpszClassName;  ///< The class's name, such as "Q_Exception".
  int m_nObjectSize;            ///< sizeof the class.
  CRuntimeClass* m_pBaseClass;  ///< The base class's record; null for CObject.
};

/// Base of the object model, as in MFC. Not copyable.
class VARDEL_API CObject {
 public:
  /// The class's record: here classCObject. Every class overrides it.
  virtual CRuntimeClass* GetRuntimeClass() const;
  /// Virtual, so an exception is destroyed through any base pointer.
  virtual ~CObject();
  /// Does nothing: keeps MFC's virtual layout (there is no serialisation).
  virtual void Serialize(CArchive& ar);
  /// Does nothing: keeps MFC's virtual layout.
  virtual void AssertValid() const;
  /// Does nothing: keeps MFC's virtual layout (there are no dumps).
  virtual void Dump(CDumpContext& dc) const;

  /// The record of CObject: name "CObject", no base.
  static CRuntimeClass classCObject;

  /// Objects are not copied, as in MFC; classes that carry state assign it.
  CObject(const CObject&) = delete;
  /// Not assignable either; see Q_Exception::operator=.
  CObject& operator=(const CObject&) = delete;

 protected:
  /// Only derived classes make objects.
  CObject();
};

/// MFC's exception base: the two error-text operations.
class VARDEL_API CException : public CObject {
 public:
  /// An exception without text.
  CException();
  /// Virtual through CObject.
  ~CException() override;
  /// The address of classCException.
  CRuntimeClass* GetRuntimeClass() const override;

  /// Copies the error text into `lpszError` (at most `nMaxError` - 1 chars and
  /// a terminator) and gives TRUE if there was a text. `pnHelpContext`, when
  /// given, receives 0: there is no help file. This base has no text: it
  /// gives FALSE and an empty string.
  virtual platform::BOOL GetErrorMessage(char* lpszError, unsigned nMaxError, unsigned* pnHelpContext = nullptr);
  /// There is no message box on this platform: the text goes to stderr as one
  /// line. Gives 1, the answer of the box's only button.
  virtual int ReportError(unsigned nType = 0, unsigned nMessageID = 0);

  /// The record of CException: name "CException", base CObject.
  static CRuntimeClass classCException;
};

/// Root of the library's own exceptions: an error text held inside the object.
/// Catch `Q_Exception*` to take every exception the library throws; never
/// delete what you caught (N_Exceptions.h).
class VARDEL_API Q_Exception : public CException {
 public:
  /// Every class of the family answers with Q_Exception's runtime class.
  CRuntimeClass* GetRuntimeClass() const override;
  /// Runs at the end of the process: the library's exceptions are static.
  ~Q_Exception() override;
  /// As CException::GetErrorMessage, with this exception's text; TRUE if it
  /// isn't empty, FALSE (and nothing written) for a null or empty buffer.
  platform::BOOL GetErrorMessage(char* lpszError, unsigned nMaxError, unsigned* pnHelpContext = nullptr) override;
  /// Writes the text (or "No error message is available.") to stderr as one
  /// line; gives 1.
  int ReportError(unsigned nType = 0, unsigned nMessageID = 0) override;
  /// The error text, never null. It belongs to the exception and changes at
  /// the next throw of the same class, from whatever thread: copy it if it
  /// must last.
  virtual const char* getErrorMessage() const;

  /// Carries the error text over; that is all the state an exception has.
  Q_Exception& operator=(const Q_Exception& other);

  /// Printf-style text, cut to fit kMaxErrorLength. The text lives inside the
  /// object, so setting it never allocates, even when memory has run out.
  /// A null format empties the text.
  void setError(const char* format, ...) __attribute__((format(printf, 2, 3)));

  /// The longest error text kept, without its terminator.
  static constexpr unsigned kMaxErrorLength = 511;
  /// The record of Q_Exception: name "Q_Exception", base CException.
  static CRuntimeClass classQ_Exception;

 protected:
  /// An exception with an empty text; only the library's classes make them.
  Q_Exception();

 private:
  char m_szError[kMaxErrorLength + 1];
};
