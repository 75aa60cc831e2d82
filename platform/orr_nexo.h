/*
 * Nexo, the host's system-information tree: named nodes, some of them lists
 * of instances, with handlers that the host calls to list a node's
 * instances, to get a node into an output record, or to set it from input
 * arguments.
 *
 * A module declares its branch as constant data (Nexo_Tree) in its module
 * information; the loader installs the branch once the module is loaded and
 * removes it before the module is unloaded, so handlers run only while the
 * module is loaded. Records and enumerations are described alongside so that
 * the host's tools can show output records with their labels.
 */
#pragma once

#include "platform/orr_base.h"

/*
 * A typed argument list owned by the host: the instance keys of a node's
 * path (outermost first), a set handler's input arguments, or the list a
 * list handler fills. Valid for the duration of one handler call.
 */
typedef struct Nexo_ParamList Nexo_ParamList;

/* The most entries any parameter list holds. */
#define NEXO_PARAM_LIST_CAPACITY 64u

/*
 * Argument `index` as a signed or unsigned 32-bit number. ORR_NOT_FOUND when
 * absent; ORR_BAD_PARAM when it is not a number or does not fit 32 bits
 * (an instance key is kept as its 32-bit pattern, so either reading works).
 */
ORR_API orr_Status Nexo_ParamListGetInt32(const Nexo_ParamList *list, uint32_t index, int32_t *value);
ORR_API orr_Status Nexo_ParamListGetUInt32(const Nexo_ParamList *list, uint32_t index, uint32_t *value);
/*
 * Argument `index` as text: `*text` points at the host's terminated copy,
 * valid until the handler returns. ORR_NOT_FOUND when absent; ORR_BAD_PARAM
 * when it is not text.
 */
ORR_API orr_Status Nexo_ParamListGetString(const Nexo_ParamList *list, uint32_t index, const char **text);
/* The number of arguments in the list. */
ORR_API orr_Status Nexo_ParamListUsedCount(const Nexo_ParamList *list, uint32_t *count);
/* Appends a number to a list being filled; ORR_LIMIT_EXCEEDED when it is full. */
ORR_API orr_Status Nexo_ParamListAddInt(Nexo_ParamList *list, int64_t value);

/* ------------------------------------------------------------ records */

typedef enum Nexo_FieldType : uint32_t {
   NEXO_FIELD_U8 = 1,      /* one byte, shown as "%u" */
   NEXO_FIELD_CHARS = 2,   /* char[size], zero-terminated text */
   NEXO_FIELD_ENUM32 = 3,  /* 4-byte enumeration, shown by its element's label */
} Nexo_FieldType;

typedef struct Nexo_EnumElement {
   uint32_t value;
   const char *name;
   const char *label;
} Nexo_EnumElement;

typedef struct Nexo_EnumDef {
   const char *name;
   const char *label;
   const Nexo_EnumElement *elements;
   uint32_t numElements;
} Nexo_EnumDef;

typedef struct Nexo_FieldDef {
   const char *name;
   const char *label;               /* padded as the module gives it */
   Nexo_FieldType type;
   uint32_t offset;
   uint32_t size;
   const Nexo_EnumDef *enumDef;     /* NEXO_FIELD_ENUM32 only; else null */
} Nexo_FieldDef;

typedef struct Nexo_RecordDef {
   const char *name;
   const char *label;
   uint32_t size;                   /* bytes the host hands to a get handler */
   const Nexo_FieldDef *fields;
   uint32_t numFields;
} Nexo_RecordDef;

/* ------------------------------------------------------------ nodes */

typedef enum Nexo_NodeKind : uint32_t {
   NEXO_NODE_BRANCH = 1,      /* children only */
   NEXO_NODE_LEAF = 2,        /* get and set */
   NEXO_NODE_LIST = 3,        /* instances (one key each), children per instance */
   NEXO_NODE_LEAF_LIST = 4,   /* instances, and get and set per instance */
} Nexo_NodeKind;

typedef struct Nexo_NodeDef Nexo_NodeDef;

/*
 * Handlers. `instanceArgs` holds the keys of the instance lists on the
 * node's path, outermost first (for a leaf list, its own key last when the
 * path names one). A list handler appends instance keys to `list`; a get
 * handler fills `output`, the node's output record (size bytes, not
 * zeroed); a set handler reads `input`. Each returns a host status, which
 * the host hands to the requester.
 */
typedef orr_Status (*Nexo_ListFn)(const Nexo_NodeDef *node, const Nexo_ParamList *instanceArgs,
                                  Nexo_ParamList *list);
typedef orr_Status (*Nexo_GetFn)(const Nexo_NodeDef *node, const Nexo_ParamList *instanceArgs, void *output);
typedef orr_Status (*Nexo_SetFn)(const Nexo_NodeDef *node, const Nexo_ParamList *instanceArgs,
                                 const Nexo_ParamList *input);

/* The host's handlers that do nothing and succeed. */
ORR_API orr_Status Nexo_NULL_Get(const Nexo_NodeDef *node, const Nexo_ParamList *instanceArgs, void *output);
ORR_API orr_Status Nexo_NULL_Set(const Nexo_NodeDef *node, const Nexo_ParamList *instanceArgs,
                                 const Nexo_ParamList *input);

#define NEXO_NO_PARENT 0u

struct Nexo_NodeDef {
   uint32_t id;                     /* unique, never NEXO_NO_PARENT */
   const char *name;
   uint32_t parentId;               /* NEXO_NO_PARENT for the branch's root */
   Nexo_NodeKind kind;
   Nexo_ListFn list;                /* lists only */
   Nexo_GetFn get;                  /* leaves only; null: no get */
   Nexo_SetFn set;                  /* leaves only; null: no set */
   /*
    * Input argument count rule of the set handler: the host refuses a set
    * with fewer than minArgs or more than maxArgs arguments (ORR_BAD_PARAM)
    * without calling the handler; the handler checks finer rules itself.
    */
   uint32_t minArgs;
   uint32_t maxArgs;
   const Nexo_RecordDef *output;    /* the get handler's record; null: none */
};

/*
 * A module's branch: the nodes, parents before children, children in the
 * order they are listed; exactly one root. The records are those the nodes
 * name, published for the host's tools.
 */
typedef struct Nexo_Tree {
   const Nexo_NodeDef *nodes;
   uint32_t numNodes;
   const Nexo_RecordDef *const *records;
   uint32_t numRecords;
} Nexo_Tree;
