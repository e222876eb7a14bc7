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

# keymgr_policy_key(PEM VAR): checks that the file PEM holds an RSA-2048
# public key with the exponent 65537, the vendor key that signs each release's
# policies (the TPM verifies RSA, not Ed25519), and sets VAR to its modulus as
# 512 hex digits.
function(keymgr_policy_key pem var)
  find_program(KEYMGR_OPENSSL openssl REQUIRED)
  execute_process(COMMAND ${KEYMGR_OPENSSL} rsa -pubin -in ${pem} -noout -text
                  RESULT_VARIABLE _rc OUTPUT_VARIABLE _text ERROR_VARIABLE _err)
  if(NOT _rc EQUAL 0)
    message(FATAL_ERROR "${pem} is not an RSA public key in PEM: ${_err}")
  endif()
  if(NOT _text MATCHES "Public-Key: \\(2048 bit\\)" OR NOT _text MATCHES "Exponent: 65537 ")
    message(FATAL_ERROR "${pem} is not an RSA-2048 key with the exponent 65537")
  endif()
  execute_process(COMMAND ${KEYMGR_OPENSSL} rsa -pubin -in ${pem} -noout -modulus
                  OUTPUT_VARIABLE _modulus OUTPUT_STRIP_TRAILING_WHITESPACE)
  string(REGEX REPLACE "^Modulus=" "" _modulus "${_modulus}")
  string(LENGTH "${_modulus}" _length)
  if(NOT _length EQUAL 512)
    message(FATAL_ERROR "${pem}: unexpected modulus '${_modulus}'")
  endif()
  set(${var} ${_modulus} PARENT_SCOPE)
endfunction()
