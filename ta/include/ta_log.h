/*
 * ta_log.h - the TA's trace macros. Every line carries the emitting
 * function's name and source line. Key material is never logged.
 */
#ifndef TA_LOG_H
#define TA_LOG_H

#include <tee_internal_api.h>

#define KM_TRACE_IDENT "KEYMASTER"

#define KM_TRACE_AT(level, func, line, ...) TEE_Trace((level), KM_TRACE_IDENT, (func), (line), __VA_ARGS__)
#define KM_ERR(...) KM_TRACE_AT(TEE_TRACE_ERROR, __func__, __LINE__, __VA_ARGS__)
#define KM_INFO(...) KM_TRACE_AT(TEE_TRACE_INFO, __func__, __LINE__, __VA_ARGS__)
#define KM_DEBUG(...) KM_TRACE_AT(TEE_TRACE_DEBUG, __func__, __LINE__, __VA_ARGS__)
#define KM_FLOW(...) KM_TRACE_AT(TEE_TRACE_FLOW, __func__, __LINE__, __VA_ARGS__)

#endif
