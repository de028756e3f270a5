// Schema of the cache's two tables.
//
// Directories table, columns in order: "ID" (Int32, id from 1), "PATHNAME"
// (Text, one path component; "/" for a tree's first row), "PARENTID" (Int32,
// 0 at the top), "CREATIONTIME" (Int32, epoch seconds of the last scan, 0 for
// a row that only carries a path).  Hash indexes <table>_PATHNAME, <table>_ID,
// <table>_PARENTID, in that order.
//
// Files table, columns in order: "FILENAME" (Text), "ATTR" (Int32), "SIZE"
// (Int64), "PATHID" (Int32, the directory's ID), "MD5" (Text, "0" when not
// computed), "CRC32" (Int32), "Q32" (Int32).  Hash indexes <table>_FILENAME,
// <table>_PATHID.
#ifndef FSCANNER_FSCOMMON_CACHETABLES_H
#define FSCANNER_FSCOMMON_CACHETABLES_H

namespace cachetables {
const unsigned int TYPE_INT32 = 3;
const unsigned int TYPE_INT64 = 4;
const unsigned int TYPE_TEXT = 5;
const unsigned int DIRECTORY_COLUMNS = 4;
const unsigned int FILE_COLUMNS = 7;
extern wchar_t const* const directoryColumns[DIRECTORY_COLUMNS];
extern unsigned int const directoryTypes[DIRECTORY_COLUMNS];
extern wchar_t const* const directoryIndexes[3];
extern wchar_t const* const fileColumns[FILE_COLUMNS];
extern unsigned int const fileTypes[FILE_COLUMNS];
extern wchar_t const* const fileIndexes[2];
// The shared lookup variables, in order, and their types.
extern wchar_t const* const variableNames[10];
extern unsigned int const variableTypes[10];
// The prepared criteria, in order.
extern wchar_t const* const criteriaTexts[7];
}  // namespace cachetables

#endif
