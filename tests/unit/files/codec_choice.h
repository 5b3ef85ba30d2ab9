/**
 * @file codec_choice.h
 * @brief Chooses the codec that the archive code under test gets, whatever the build is configured
 * with.
 */
#ifndef CODEC_CHOICE_H
#define CODEC_CHOICE_H

enum class ArchiveCodec { kIsal, kZlib, kNone /**< memory is out */ };

/** From now on; kIsal at the start. One thread. */
void choose_codec(ArchiveCodec codec);

#endif
