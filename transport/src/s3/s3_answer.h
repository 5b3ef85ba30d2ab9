/**
 * @file s3_answer.h
 * @brief What an S3 service says of a request and of an object.
 *
 * Any thread.
 */
#ifndef BACKUP_TRANSPORT_S3_ANSWER_H
#define BACKUP_TRANSPORT_S3_ANSWER_H

#include <string>

#include "http/http_store.h"
#include "s3/s3_xml.h"

namespace transport {

/** Header in which the library keeps an object's MD5. */
constexpr char kChecksumHeader[] = "x-amz-meta-md5";

/** The service's code becomes what it means, and part of the message. */
void explain(const S3Error &error, Outcome *outcome);

/** outcome_of(). The object itself being absent is looked at before this is asked. */
Outcome s3_outcome(const HttpAnswer &answer, const char *what);

/** The service says that there is no such object, though there is the bucket. */
bool is_absent_object(const HttpAnswer &answer);

/** The entity tag without its quotes; "" when there is none. */
std::string etag_of(const HttpAnswer &answer);

/** What an object's content must have as its MD5, in hexadecimal; "" when that is not known. */
std::string expected_md5(const HttpAnswer &answer);

/** An MD5 as Content-MD5 has it. @param hex 32 hexadecimal digits */
std::string to_base64(const std::string &hex);

}  // namespace transport

#endif
