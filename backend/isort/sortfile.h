// Fortran-callable entries of the sort library, and the C++ pieces behind them.
//
// Calling conventions of the entries (SORTFILE, SRTFPK, SRTFUP, SRTFVA):
// - stdcall on 32-bit Windows (VEXA_STDCALL), where the DLL exports them as
//   _SORTFILE@44, _SRTFPK@32, _SRTFUP@28 and _SRTFVA@40; plain C elsewhere.
//   SrtUnpack is plain C with the caller-cleans convention on every platform.
// - Every argument is passed by address, as Fortran passes it; SrtUnpack
//   alone takes its counts by value.
// - A Fortran INTEGER is FortranInt (32 bits on every platform). Record
//   values are OBS, 8 bytes each, moved as bit patterns.
// - Variables are numbered from 1; a FileSort::SortKey counts from 0.
// - Nothing is thrown out of an entry except what SORTFILE lets through: an
//   exception of a type it does not know, thrown by a C++ callback.
//
// Key array (MakeCSortKeys, SORTFILE, SRTFVA): 3n integers in three blocks
// of n, not n triples: the 1-based variable numbers, then the directions
// (> 0 ascending, otherwise descending), then the widths (0 numeric, else a
// string of that many bytes).
//
// Packed record (SRTFPK, SRTFUP, SrtUnpack): a header of two FortranInt
// words (the record's length in 4-byte words, header included; a value the
// caller chose), then the values of the map's key runs uncompressed, then the
// other runs, uncompressed or in the compressed case encoding (iostore.h).
// String keys in a packed record end at a 0 byte. The map is nmap pairs
// (first variable, count) in packed order, the key runs first; the key
// descriptor list is triples (offset in OBS with the header as 0, width,
// direction), closed by a triple whose width is negative. SRTFVA builds both.
//
// Threads: every entry may run on several threads at once for different
// data; none keeps state between calls.
#pragma once

#include <vector>

#include "FileSort.h"
#include "isort/host/vexatypes.h"

// Exports of the Fortran-callable entries. On Windows the module definition
// file (isort.def) is their only source, which gives them the decorated names
// the host links against; a dllexport here would add undecorated duplicates.
#if defined(_WIN32)
#define ISORT_ENTRY
#else
#define ISORT_ENTRY __attribute__((visibility("default")))
#endif

// Appends to `keys` one key per entry of the key array `ukeys` (3n values):
// variable = ukeys[i] - 1, direction = +1 if ukeys[n + i] > 0 else -1,
// width = ukeys[2n + i]. Validates nothing. Throws std::length_error when n
// keys cannot be held, std::bad_alloc when memory runs out.
ISORT_API void MakeCSortKeys(const FortranInt* ukeys, unsigned int n,
                             std::vector<FileSort::SortKey>& keys);

// A FileSort whose input and output are two caller's functions, as SORTFILE
// takes them. Both receive the caller's context unchanged and the address of
// the record width.
//
// Threads: the input function may be called from the sort's worker threads,
// one call at a time; the output function from the thread that called Sort(),
// or from a worker when the whole input fitted in one batch. Neither may
// rely on the calling thread's identity.
class ISORT_API SortFileSorter : public FileSort {
 public:
  // Writes the next record (*nvars values) to `buffer` and returns 0, or
  // returns nonzero when the input is exhausted.
  typedef FortranInt(VEXA_STDCALL* InputFunction)(void* context, OBS* buffer, FortranInt* nvars);
  // Takes the next record in key order (*nvars values, valid during the call)
  // and returns 0 to go on; any other value abandons the sort.
  typedef FortranInt(VEXA_STDCALL* OutputFunction)(void* context, const OBS* record,
                                                   FortranInt* nvars);

  // Thrown by PutRecord() when the output function returns nonzero; the
  // value is OutputResult().
  class Error {};

  // REQUIRES: nvars > 0 and every key inside the record. `context` is not
  // owned and must stay valid until the object is destroyed. Throws
  // ErrorText for a key outside the record; std::bad_alloc when the record
  // buffer cannot be had (also when nvars * 8 bytes do not fit in 32 bits).
  SortFileSorter(void* context, InputFunction input, OutputFunction output, FortranInt nvars,
                 const std::vector<FileSort::SortKey>& keys);
  ~SortFileSorter() override;

  // Calls the input function into the record buffer: the buffer, or null
  // once the function reports the end.
  const OBS* GetRecord() override;
  // Calls the output function; throws Error when it returns nonzero.
  void PutRecord(const OBS* record) override;

  // What the output function returned last; 0 before its first call.
  FortranInt OutputResult() const { return outputResult; }

 private:
  void* context;  // the caller's, handed to both functions unchanged; never dereferenced
  InputFunction input;
  OutputFunction output;
  FortranInt nvars;  // record width; its address is handed to both functions
  OBS* buffer;       // nvars values, owned (array new)
  FortranInt outputResult;
};

// Return codes of SORTFILE.
enum : FortranInt {
  kSortFileDone = 0,       // every record was delivered
  kSortFileReported = 5,   // an error was reported to the host (ErrorText or a failed precondition)
  kSortFileNoMemory = 11,  // memory ran out
  kSortFileGoToCaller = 14,  // the host abandoned the operation (VexaGoToCaller)
};

extern "C" {

// Sorts the records that `input` hands in by the keys of `ukeys` (3 *
// *nukeys values) and hands them to `output` in key order; equal keys keep
// their input order. Runs on the calling thread until the sort is over.
// Returns 0; the output function's value when it returned nonzero (the sort
// stops at that record); 5 when an ErrorText was raised and reported to the
// host, or when a precondition failed; 11 when memory ran out; 14 when the
// host raised VexaGoToCaller.
// REQUIRES (each failure is reported to the runtime's assertion facility,
// then 5 is returned without touching the arrays or calling back):
// *nvars > 0, *nukeys > 0, ukeys not null. unused7 to unused9 are never read
// and may be null. *zero10 and *zero11 are set to 0 on every return, when
// the pointers are not null.
ISORT_ENTRY FortranInt VEXA_STDCALL SORTFILE(void* context, SortFileSorter::InputFunction input,
                                             SortFileSorter::OutputFunction output,
                                             const FortranInt* nvars, const FortranInt* ukeys,
                                             const FortranInt* nukeys, const void* unused7,
                                             const void* unused8, const void* unused9,
                                             FortranInt* zero10, FortranInt* zero11);

// Packs `caseValues` into `packed` by the map (*nmap pairs): the first
// *nkeypairs runs uncompressed, the others compressed when *compress is
// nonzero (otherwise every run uncompressed; *nkeypairs is then not read).
// Header word 1 is *header1. String keys of `keys` are ended by a 0 byte
// where their trailing blanks began. `packed` must hold 8 bytes of header, 8
// per mapped value and, when compressing, 8 per started group of 8
// compressed values.
ISORT_ENTRY void VEXA_STDCALL SRTFPK(const OBS* caseValues, FortranInt* packed,
                                     const FortranInt* header1, const FortranInt* map,
                                     const FortranInt* keys, const FortranInt* nmap,
                                     const FortranInt* nkeypairs, const FortranInt* compress);

// Unpacks the packed record at `packed` into `caseValues` (variables outside
// the map are left as they were). Restores the string keys' blanks inside
// the packed record, which is therefore modified.
ISORT_ENTRY void VEXA_STDCALL SRTFUP(FortranInt* packed, OBS* caseValues, const FortranInt* map,
                                     const FortranInt* keys, const FortranInt* nmap,
                                     const FortranInt* nkeypairs, const FortranInt* compress);

// SRTFUP's plain-C form: `data` is the packed record's byte 8, just after the
// header. A compressed record is decoded no further than the length in its
// header; a value whose code is undefined, or whose bytes lie past that
// length, becomes the system-missing value.
ISORT_ENTRY void SrtUnpack(OBS* data, OBS* caseValues, const FortranInt* map,
                           const FortranInt* keys, FortranInt nmap, FortranInt nkeypairs,
                           int compress);

// Checks the key array (*n keys in `ukeys`) against a case of *widraw values
// and builds the map and key descriptor list that SRTFPK and SRTFUP take.
// Bit 0 of *pack: build the packing map (else the counts are 0 and the key
// triples hold the variable numbers). Bit 0 of *fill: write keysOut (*n + 1
// triples) and mapOut (*nmapOut pairs); otherwise only the counts, so that a
// caller can size the arrays first. Any number of keys; no shared state.
// Returns 0, or 10 when a key is invalid (variable below 1, running past the
// case, direction other than 1 or -1, negative width), when *n is negative,
// or when the keys cannot be ordered for lack of memory; the three counts
// are then 0 and the arrays untouched.
ISORT_ENTRY FortranInt VEXA_STDCALL SRTFVA(const FortranInt* n, const FortranInt* ukeys,
                                           FortranInt* keysOut, FortranInt* mapOut,
                                           FortranInt* nmapOut, FortranInt* nkeypairsOut,
                                           FortranInt* keylengthOut, const FortranInt* widraw,
                                           const FortranInt* pack, const FortranInt* fill);

}  // extern "C"
