dnl Stand-ins for the platform policy macros that android/sepolicy uses, written from what
dnl they are documented to grant, so that the policy can be expanded and compiled without an
dnl Android tree. They grant at least what the platform's do; the platform's neverallow rules
dnl are not here.
dnl
dnl The build variant decides whether debug-only rules exist: set target_build_variant with -D.
define(`userdebug_or_eng', `ifelse(target_build_variant, `user', `', `$1')')dnl
dnl
dnl Permission sets.
define(`x_file_perms', `{ getattr execute execute_no_trans map }')dnl
define(`r_file_perms', `{ getattr open read ioctl lock map }')dnl
define(`w_file_perms', `{ open append write lock map }')dnl
define(`rw_file_perms', `{ r_file_perms w_file_perms }')dnl
define(`create_file_perms', `{ create rename setattr unlink rw_file_perms }')dnl
define(`r_dir_perms', `{ open getattr read search ioctl lock }')dnl
define(`w_dir_perms', `{ open search write add_name remove_name lock }')dnl
define(`rw_dir_perms', `{ r_dir_perms w_dir_perms }')dnl
define(`create_dir_perms', `{ create reparent rename rmdir setattr rw_dir_perms }')dnl
dnl
dnl init_daemon_domain(d): init starts d_exec in the domain d.
define(`init_daemon_domain', `
allow init $1_exec:file { r_file_perms execute };
allow init $1:process transition;
allow $1 $1_exec:file { entrypoint open read getattr execute map };
allow $1 init:process sigchld;
type_transition init $1_exec:process $1;
')dnl
dnl
dnl r_dir_file(d, t): d reads the directories, files and links of type t.
define(`r_dir_file', `
allow $1 $2:dir r_dir_perms;
allow $1 $2:{ file lnk_file } r_file_perms;
')dnl
dnl
dnl get_prop(d, p): d reads the properties of type p (the mapped property area).
define(`get_prop', `
allow $1 $2:file r_file_perms;
')dnl
dnl
dnl set_prop(d, p): d asks init, through the property socket, to set properties of type p.
define(`set_prop', `
allow $1 property_socket:sock_file write;
allow $1 init:unix_stream_socket connectto;
allow $1 $2:property_service set;
get_prop($1, $2)
')dnl
