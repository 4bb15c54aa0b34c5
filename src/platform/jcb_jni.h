/* Java native-call bridge, the JNI side: what a native method hands the bridge for one call of a
   monitor entry point, and how the outcome of that call goes back to Java. A native method fills
   a jcb_context with jcbBeginCall, passes it to the entry point, which reads its arguments and
   sets its result through the services of jcb.h, and ends with jcbEndCall, which raises the
   bridge's exception when the entry point failed. */
#pragma once
#include <jni.h>
#include <stdint.h>

#include "jcb.h"

#ifdef __cplusplus
extern "C" {
#endif

/* Results of jcbGetBooleanArgument; each failure leaves its reason in jcbGetLastErrorMessage. */
enum {
    JCB_OK = 0,
    JCB_NO_ENVIRONMENT = 1,    /* a null context, or one without a JNI environment */
    JCB_NO_OUTPUT = 2,         /* a null pointer for the value */
    JCB_EXCEPTION_PENDING = 3, /* a Java exception is pending in the calling thread */
    JCB_NO_ARGUMENT = 4,       /* every argument of the call has been taken already */
    JCB_NOT_BOOLEAN = 5,       /* the next argument is neither a boolean nor a Boolean */
};

/* The exception a failed call raises, constructed as (String message, int src, int crc,
   Throwable cause): src and crc are the unsigned return codes of the call, cause the Java
   exception that was pending when the call ended, or null. */
#define JCB_EXCEPTION_CLASS "telv/monitor/HostMonitorException"

/* Longest message, NUL included; a longer one is cut at a character boundary. */
#define JCB_MESSAGE_SIZE 1024

/* One argument as the native method received it. */
typedef struct jcb_argument {
    char type;    /* its JNI signature letter: 'Z' boolean, 'I' int, 'L' an object, ... */
    jvalue value; /* of that type; an object is a reference valid for the whole call */
} jcb_argument;

/* One native call. Filled by jcbBeginCall; read and written only through the bridge. */
struct jcb_context {
    JNIEnv *env;                   /* of the calling thread */
    const jcb_argument *arguments; /* the call's arguments, in order (none: null) */
    int argument_count;
    int next_argument; /* the one jcbGetBooleanArgument takes next */
    int failed;        /* 1 once the entry point set a native-function error */
    int codes_set;     /* 1 once it set src and crc */
    int void_result;   /* 1 once it said the call has no result */
    uint32_t src;      /* its return codes, for the exception */
    uint32_t crc;
    char message[JCB_MESSAGE_SIZE]; /* the native-function error (UTF-8), NUL-terminated */
};

/* Starts a call: `arguments` (`count` of them) must live until jcbEndCall. */
void jcbBeginCall(jcb_context *ctx, JNIEnv *env, const jcb_argument *arguments, int count);

/* Ends the call after the entry point `function` returned `rc`. A native-function error, or an
   rc other than 0 (taken as an error "function() returned rc"), raises the bridge's exception
   with the codes set by jcbSetReturnCodes, else with src = rc and crc = 0; an exception pending
   already becomes its cause. Returns 1 when a Java exception is pending on return, else 0. */
int jcbEndCall(jcb_context *ctx, const char *function, int rc);

#ifdef __cplusplus
}
#endif
