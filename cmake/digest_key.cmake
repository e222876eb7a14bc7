# keymgr_digest_key(PEM VAR): checks that the file PEM holds an Ed25519 public
# key in PEM, as "openssl pkey -pubout" writes it, and sets VAR to its 32
# bytes as 64 hex digits.
function(keymgr_digest_key pem var)
  find_program(KEYMGR_OPENSSL openssl REQUIRED)
  set(_der ${CMAKE_CURRENT_BINARY_DIR}/${var}.der)
  execute_process(COMMAND ${KEYMGR_OPENSSL} pkey -pubin -in ${pem} -outform DER -out ${_der}
                  RESULT_VARIABLE _rc ERROR_VARIABLE _err)
  if(NOT _rc EQUAL 0)
    message(FATAL_ERROR "${pem} is not a public key in PEM: ${_err}")
  endif()
  file(READ ${_der} _hex HEX)
  file(REMOVE ${_der})
  # An Ed25519 SubjectPublicKeyInfo is 12 bytes of algorithm and framing, then
  # the key.
  string(LENGTH "${_hex}" _length)
  if(NOT _length EQUAL 88 OR NOT _hex MATCHES "^302a300506032b6570032100")
    message(FATAL_ERROR "${pem} is not an Ed25519 public key")
  endif()
  string(SUBSTRING "${_hex}" 24 64 _key)
  set(${var} ${_key} PARENT_SCOPE)
endfunction()
