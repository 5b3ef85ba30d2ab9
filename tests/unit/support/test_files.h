/**
 * @file test_files.h
 * @brief Files of a test: writing, reading, looking.
 */
#ifndef TEST_FILES_H
#define TEST_FILES_H

#include <string>

/** The whole file; empty when it cannot be read. */
std::string read_text(const std::string &path);

/** Write a whole file, with the directories above it; the test fails when that does not work. */
void write_text(const std::string &path, const std::string &content);

/** Whether anything is there, be it a link to nowhere. */
bool exists(const std::string &path);

#endif
