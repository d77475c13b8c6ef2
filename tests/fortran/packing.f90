! SRTFVA on a worked example, then SRTFPK and SRTFUP with its map, with and
! without compression: the header word, the trimmed string key, and the case
! back bit for bit (values held as 8-byte integers so that every pattern,
! a signaling NaN included, is compared exactly).
program packing
  use isort_api
  implicit none
  integer(c_int32_t), parameter :: widraw = 10
  integer(c_int32_t) :: ukeys(9), keys(12), map(2 * (widraw + 1))
  integer(c_int32_t) :: nmap, nkeypairs, keylength, code, n, pack, fill, compress, header1
  integer(c_int32_t) :: packed(2 + 2 * widraw + 2 * 2), expected_map(10), expected_keys(12)
  integer(c_int64_t) :: case(widraw), back(widraw)
  character(len=16) :: text
  character(len=4) :: word
  integer :: c

  ! Keys on variable 5 (numeric), 2 (a 12-byte string) and 6 (numeric).
  ukeys = [5, 2, 6, 1, -1, 1, 0, 12, 0]
  n = 3
  pack = 1
  fill = 0
  map = -1
  keys = -1
  code = srtfva(n, ukeys, keys, map, nmap, nkeypairs, keylength, widraw, pack, fill)
  call check(code == 0, 'SRTFVA sizes')
  call check(nmap == 5 .and. nkeypairs == 2 .and. keylength == 4, 'SRTFVA counts')
  call check(all(map == -1) .and. all(keys == -1), 'SRTFVA without filling writes no array')
  fill = 1
  code = srtfva(n, ukeys, keys, map, nmap, nkeypairs, keylength, widraw, pack, fill)
  expected_map = [2, 2, 5, 2, 1, 1, 4, 1, 7, 4]
  expected_keys = [3, 0, 1, 1, 12, -1, 4, 0, 1, 1, -1, 1]
  call check(code == 0, 'SRTFVA fill')
  call check(all(map(1:10) == expected_map), 'SRTFVA map')
  call check(all(keys == expected_keys), 'SRTFVA key list')

  ! The case: a small integer, the string "AB" (12 bytes, blank-padded),
  ! a signaling NaN, the two numeric keys, eight blanks, the system-missing
  ! value (-huge), -0.0 and 151.
  case(1) = transfer(1.0_c_double, 0_c_int64_t)
  text = 'AB          wxyz'
  case(2:3) = transfer(text, 0_c_int64_t, 2)
  case(4) = int(z'7FF0000000000001', c_int64_t)
  case(5) = transfer(-2.5_c_double, 0_c_int64_t)
  case(6) = transfer(1.0e10_c_double, 0_c_int64_t)
  case(7) = transfer('        ', 0_c_int64_t)
  case(8) = transfer(-huge(1.0_c_double), 0_c_int64_t)
  case(9) = transfer(-0.0_c_double, 0_c_int64_t)
  case(10) = transfer(151.0_c_double, 0_c_int64_t)

  do c = 0, 1
    compress = c
    header1 = 1234
    packed = 0
    call srtfpk(case, packed, header1, map, keys, nmap, nkeypairs, compress)
    if (compress == 0) then
      call check(packed(1) == 2 * (1 + widraw), 'header word, uncompressed')
    else
      ! 4 key values, one group of 6 codes with 2 literals (NaN, -0.0).
      call check(packed(1) == 2 * (1 + 4 + 1 + 2), 'header word, compressed')
      word = transfer(packed(11), word)
      call check(ichar(word(1:1)) == 101 .and. ichar(word(2:2)) == 253 .and. &
                 ichar(word(3:3)) == 254 .and. ichar(word(4:4)) == 255, 'codes 1 to 4')
      word = transfer(packed(12), word)
      call check(ichar(word(1:1)) == 253 .and. ichar(word(2:2)) == 251 .and. &
                 ichar(word(3:3)) == 0 .and. ichar(word(4:4)) == 0, 'codes 5 to 8')
    end if
    call check(packed(2) == 1234, 'header word 1 carried')
    ! The string key is packed first (offset 1: bytes 8-19), ended by a 0 byte.
    word = transfer(packed(3), word)
    call check(word == 'AB' // achar(0) // ' ', 'string key trimmed')
    back = -1
    call srtfup(packed, back, map, keys, nmap, nkeypairs, compress)
    call check(all(back == case), 'round trip bit for bit')
    word = transfer(packed(3), word)
    call check(word == 'AB  ', 'string key restored in the packed record')
  end do
  print '(a)', 'packing: all checks passed'
end program
