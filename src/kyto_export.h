/*
 * KYTO_EXPORT marks what libkytoinstallcpp exports to the programs that load it (the
 * interface's update handlers, the auto-update job).  The library is built with hidden
 * symbols by default, so its internal helpers stay out of the dynamic symbol table and
 * cannot be bound to by accident; only the classes marked here form its interface.
 */
#ifndef KYTOINSTALLCPP_KYTO_EXPORT_H
#define KYTOINSTALLCPP_KYTO_EXPORT_H

#if defined(__GNUC__) || defined(__clang__)
#define KYTO_EXPORT __attribute__((visibility("default")))
#else
#define KYTO_EXPORT
#endif

#endif
