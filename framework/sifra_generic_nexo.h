/*
 * Management records declared as constant data, one line a field: the
 * field's name is the member's, its place and size the member's in the
 * record.
 */
#pragma once

#include "framework/sifra_generic.h"
#include "platform/orr_nexo.h"

#include <cstddef>

/* Member `member` of `Record`, shown as `text`; `kind` a NEXO_FIELD_ type, `enumeration` its values or nullptr. */
#define SIFRAGENERIC_NEXO_FIELD(Record, member, text, kind, enumeration)                                    \
   {.name = #member, .label = (text), .type = (kind), .offset = offsetof(Record, member),                   \
    .size = sizeof(Record::member), .enumDef = (enumeration)}
#define SIFRAGENERIC_NEXO_CHARS(Record, member, text) \
   SIFRAGENERIC_NEXO_FIELD(Record, member, text, NEXO_FIELD_CHARS, nullptr)

/* The record `Record`, named `recordName`, of the fields in the table `table`. */
#define SIFRAGENERIC_NEXO_RECORD(Record, recordName, text, table)                                            \
   {.name = (recordName), .label = (text), .size = sizeof(Record), .fields = (table),                       \
    .numFields = SifraGenericCountOf(table)}
